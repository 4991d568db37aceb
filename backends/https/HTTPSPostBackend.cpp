#include "backends/https/HTTPSPostBackend.h"

#include "backends/https/PostReply.h"
#include "platform/DeviceProperties.h"
#include "platform/Platform.h"
#include "platform/UserDefaults.h"
#include "platform/base/Counters.h"
#include "platform/base/UserBudget.h"
#include "platform/objects/Description.h"
#include "platform/objects/Keys.h"
#include "platform/queues/LineLimits.h"
#include "platform/queues/LineOrder.h"
#include "platform/queues/Log.h"
#include "platform/queues/SerialQueue.h"

namespace kyt {

namespace {

bool isSessionStop(uint16_t method, uint16_t respCode) {
  return method == 0 && respCode == 1;
}

Value numberOrMinusOne(Value number) {
  return number.isNull() ? Value(-1) : number;
}

std::optional<Array> clientsOf(const Dictionary& profile) {
  const Array* list = profile.array("clients");
  return list != nullptr ? std::optional(*list) : std::nullopt;
}

std::optional<String> textEntry(const Dictionary* dictionary, const char* key) {
  const String* text = dictionary != nullptr ? dictionary->string(key) : nullptr;
  return text != nullptr ? std::optional(*text) : std::nullopt;
}

// The addresses that the device's own settings name.
Decision decisionOf(Platform& platform) {
  Decision decision;
  const Value post = platform.userDefaults.value(kKYTReportingDefaultsDomain, "httpsPostURL");
  if (const String* url = post.string()) {
    platform.log.debug("HTTPSPostBackend(initWithName): Using user default '%s' for postURL", url->c_str());
    decision.postURL = *url;
    decision.useDefaultPostURL = true;
  }
  const Value realtime = platform.userDefaults.value(kKYTReportingDefaultsDomain, "httpsRealtimePostURL");
  if (const String* url = realtime.string()) {
    platform.log.debug("HTTPSPostBackend(initWithName): Using user default '%s' for realtimePostURL",
                       url->c_str());
    decision.realtimePostURL = *url;
    decision.useDefaultRealtimePostURL = true;
  }
  return decision;
}

}  // namespace

std::shared_ptr<HTTPSPostBackend> HTTPSPostBackend::initWithName(Configuration& configuration,
                                                                 const std::optional<String>& name,
                                                                 const std::optional<Dictionary>& profile,
                                                                 SharedSessionFacts facts) {
  if (!name || !profile) return nullptr;
  if (!clientsOf(*profile)) {
    configuration.platform.log.error("HTTPSPostBackend(initWithName): can't find the client list.");
    return nullptr;
  }
  return std::make_shared<HTTPSPostBackend>(Making(), configuration, *name, *profile, std::move(facts));
}

HTTPSPostBackend::HTTPSPostBackend(Making making, Configuration& configuration, String name,
                                   Dictionary profile, SharedSessionFacts facts)
    : KYTReportingBackend(making, configuration.platform, std::move(name), std::move(profile),
                          std::move(facts)),
      configuration_(configuration),
      records_(configuration, sharedFacts()),
      decision_(decisionOf(configuration.platform)),
      device_(readDevice()),
      rules_(configuration.platform,
             {this->name(), clientsOf(this->profile()), sharedFacts(), samplingFactor(), device_.dnuEnabled}),
      line_(configuration.platform.executor) {
  setDisplayURL(textEntry(&this->profile(), "display_url"));
}

void HTTPSPostBackend::cleanup() {
  line_.finish();
  KYTReportingBackend::cleanup();
}

HTTPSPostBackend::~HTTPSPostBackend() {
  drainStateQueue();
  // What no flush took is lost with the session. Nobody else can reach the batch any more.
  if (!batch_.exists()) return;
  EventBatch::Taken batch = batch_.take(combinedSessionIDOnQueue());
  standing()->setBatch(0, 0);
  giveBackToUser(batch.bytes);
  showFate(batch.events, batch.records, Reason::batchDiscarded);
  batch.events.drop(platform().counters, Reason::batchDiscarded);
  tellDiscarded(batch.records.size(),
                lacksUserInfo() ? "user information was promised and is missing"
                : stateOnQueue() == kBackendStateEnabled
                    ? "a single message was batched, since its client entry has \"expedite\" 0"
                    : "the back end was not enabled");
}

HTTPSPostBackend::Device HTTPSPostBackend::readDevice() {
  Device device;
  device.dnuEnabled = platform().consent.isSubmissionAllowed();
  device.uuidRespectDnu = getPersistentIdentifierForDNU(true);
  device.uuidOverrideDnu = getPersistentIdentifierForDNU(false);
  device.forceEventLogging =
      platform().userDefaults.value(kKYTReportingDefaultsDomain, "forceEventLogging").boolValue();
  return device;
}

// Promised, but not there yet.
bool HTTPSPostBackend::lacksUserInfo() const {
  return facts().requireUserInfo && (userInfo() == nullptr || userInfo()->empty());
}

void HTTPSPostBackend::updateState() {
  // A frozen state is not even written again: a reply may be disabling the back end at this moment.
  if (immutable_) return;
  const int32_t state = updateBackendState();
  setState(state, rules_.rule());
}

int32_t HTTPSPostBackend::updateBackendState() {
  if (immutable_) return state();
  const int32_t state = rules_.decide(decision_, userInfo(),
                                      userAccount() ? std::optional(userAccount()->user()) : std::nullopt);
  if (decision_.batchEvents) setBatchEvents(*decision_.batchEvents);
  if (decision_.samplingThreshold) setSamplingThreshold(*decision_.samplingThreshold);
  if (decision_.eventWhitelist) setEventWhitelist(decision_.eventWhitelist);
  if (decision_.eventBlacklist) setEventBlacklist(decision_.eventBlacklist);
  return state;
}

Dictionary HTTPSPostBackend::newEventDictfromPayload(Dictionary payload, const TimeValue& timestamp,
                                                     uint16_t method, uint16_t respCode, EventID) const {
  return records_.record(std::move(payload), {timestamp, method, respCode, eventNumber()},
                         combinedSessionIDString(), userInfo() != nullptr ? userInfo()->size() : 0);
}

void HTTPSPostBackend::mergeInformation(Dictionary& event, const Dictionary* frameworkData) const {
  if (userInfo() != nullptr) event.merge(*userInfo());
  if (frameworkData != nullptr) event.merge(*frameworkData);
}

void HTTPSPostBackend::prepareEventForMessage(Dictionary& event, const Dictionary* frameworkData) const {
  mergeInformation(event, frameworkData);
  filterEvent(event);
}

void HTTPSPostBackend::filterEvent(Dictionary& event) const {
  EventFilters::Digest digest = [this](const String& text) { return convertIntoSHA256(text); };
  decision_.filters.filterEvent(event, digest);
}

void HTTPSPostBackend::addStopEntries(Dictionary& payload) const {
  platform().log.debug(
      "HTTPSPostBackend(sendMessage): Adding dnu type and sampling threshold to SESSION_TYPE_STOP message dictionary");
  payload.set("Opt", decision_.dnuType);
  payload.set("SamplingThreshold", numberOrMinusOne(samplingThreshold()));
  payload.set("OverrideSampling", numberOrMinusOne(decision_.overrideSampling));
  payload.set("Batch", batchEvents() ? 1u : 0u);
}

Value HTTPSPostBackend::sendMessage(Dictionary message, const TimeValue& timestamp, uint16_t method,
                                    uint16_t respCode, EventID, MessageFlag flag) {
  if (LineOrder::holdsMuch()) line_.finish();
  struct Shared {  // what other sessions may change
    int32_t state;
    std::optional<SessionIDPath> sessionID;
  };
  const Shared now = stateQueue().sync([this] {
    stateQueue().assertCurrent();
    return Shared{stateOnQueue(), combinedSessionIDOnQueue()};
  });
  const int32_t oldState = now.state;
  if (oldState == kBackendStateDisabled) {
    dropEvent(Reason::eventDroppedByState);
    return {};
  }
  Dictionary payload = records_.takePayload(message);
  if (isSessionStop(method, respCode)) addStopEntries(payload);
  const Dictionary* frameworkData = message.dictionary(kKYTReportingMessageBlobSharedData);
  std::optional<String> sessionID;
  if (now.sessionID) sessionID = now.sessionID->text();
  const size_t room = (frameworkData != nullptr ? frameworkData->size() : 0) +
                      (userInfo() != nullptr ? userInfo()->size() : 0);
  Dictionary record =
      records_.record(std::move(payload), {timestamp, method, respCode, eventNumber()}, sessionID, room);
  prepareEventForMessage(record, frameworkData);
  // This message is deliberately still handled with the old state: it is the last of the batch that it frees.
  if (isExpedite(flag) && oldState == kBackendStateHeld) setState(kBackendStateEnabled, StateRule::expedite);
  platform().log.debug("HTTPSPostBackend(sendMessage): realtime is %d", isRealtime(flag));
  const bool undecided = oldState == kBackendStateUndecided || oldState == kBackendStateHeld;
  if (undecided || (!isRealtime(flag) && batchEvents()) || lacksUserInfo()) {
    platform().log.debug("HTTPSPostBackend(sendMessage): Batching %d, %d, %d", oldState, batchEvents(),
                         facts().requireUserInfo);
    return batchEvent(std::move(record));
  }
  return sendStandalone(std::move(record), oldState, method, respCode, flag);
}

Value HTTPSPostBackend::sendStandalone(Dictionary record, int32_t state, uint16_t method, uint16_t respCode,
                                       MessageFlag flag) {
  Value flushed;
  if (state == kBackendStateEnabled && isRealtime(flag) && stateQueue().sync([this] {
        stateQueue().assertCurrent();
        return batch_.exists();
      })) {
    platform().log.debug(
        "HTTPSPostBackend(sendMessage): Got a realtime event and some events have already been batched. Forcing Flush here to keep events in order.");
    flushed = flush(nullptr, TextOf::flushAndEvent);
  }
  platform().log.debug("HTTPSPostBackend(sendMessage): Sending %d, %d, %d", state, batchEvents(),
                       facts().requireUserInfo);
  Array records;
  records.append(Value(std::move(record)));
  BookedEvents event;
  event.add(tally());
  showFate(event, records, std::nullopt);
  const PostRequest post(configuration_, postFacts());
  PostRequest::Message message = makeMessage(post, std::move(records));
  const bool mayBeShown = post.mayBeShown();
  const String* before = flushed.string();
  const size_t least = (mayBeShown ? message.prettySize : 0) + (before != nullptr ? before->size() : 0);
  Value text;
  if ((mayBeShown || before != nullptr) && isAnswerWanted(least)) {
    if (mayBeShown) text = PostRequest::prettyText(message.json);
    if (before != nullptr)
      text = Value(formatObjects("Flushed events:\n%@\nStandalone event:\n%@", {flushed, text}));
  }
  if (before != nullptr) immutable_ = true;
  postJSONMessage(std::move(message.json), flag, method, respCode, nullptr,
                  carried(std::move(event), message.events));
  return text;
}

// Without a client ID a message carries none of its events.
BookedEvents HTTPSPostBackend::carried(BookedEvents events, size_t inMessage) const {
  if (inMessage != 0) return events;
  events.drop(platform().counters, Reason::postWithoutClientID);
  return {};
}

PostFacts HTTPSPostBackend::postFacts() const {
  PostFacts post;
  post.session = sharedFacts();
  if (decision_.extrasOnInternal != 0 && facts().isInternal) {
    post.clientID = facts().udid;
  } else if (decision_.uuidCustom) {
    post.clientID = decision_.uuidCustom;
  } else {
    post.clientID = decision_.dnuType != 0 ? device_.uuidOverrideDnu : device_.uuidRespectDnu;
  }
  post.clientName = textEntry(userInfo(), kKYTReportingUserInfoClientName);
  post.serviceName = textEntry(userInfo(), kKYTReportingUserInfoServiceName);
  post.consentShowsText = decision_.dnuType == 0 && device_.dnuEnabled;
  post.settingShowsText = device_.forceEventLogging;
  post.shouldUseWiFiOnly = decision_.shouldUseWiFiOnly;
  post.digestKey = digestKey();
  post.digestAlgorithm = digestAlgorithm();
  post.account = userAccount();
  post.sizeHint = jsonSizeHint_;
  return post;
}

PostRequest::Message HTTPSPostBackend::makeMessage(const PostRequest& post, Array records) {
  PostRequest::Message message = post.message(std::move(records));
  jsonSizeHint_ = message.json.size();
  return message;
}

std::optional<std::string> HTTPSPostBackend::createMessageForPostAndLogging(Array records,
                                                                            Value* prettyJSONString,
                                                                            size_t* events) {
  const PostRequest post(configuration_, postFacts());
  PostRequest::Message message = makeMessage(post, std::move(records));
  if (events != nullptr) *events = message.events;
  if (prettyJSONString != nullptr && post.mayBeShown())
    *prettyJSONString = PostRequest::prettyText(message.json);
  return std::move(message.json);
}

void HTTPSPostBackend::postJSONMessage(std::string json, MessageFlag flag, std::optional<uint16_t> method,
                                       std::optional<uint16_t> responseCode, FlushCompletion completion,
                                       BookedEvents events) {
  line_.finish();  // what was posted before leaves before
  std::optional<OutgoingPost> post =
      newPost(flag, method, responseCode, std::move(completion), std::move(events));
  if (post) std::move(*post).send(std::move(json));
}

std::optional<OutgoingPost> HTTPSPostBackend::newPost(MessageFlag flag, std::optional<uint16_t> method,
                                                      std::optional<uint16_t> responseCode,
                                                      FlushCompletion completion, BookedEvents events) {
  const std::optional<String>& url = isRealtime(flag) ? decision_.realtimePostURL : decision_.postURL;
  if (!url) {
    events.drop(platform().counters, Reason::postWithoutURL);
    if (platform().counters.mayTell(Reason::postWithoutURL, name().str() + std::to_string(facts().compType),
                                    platform().clock.monotonic()))
      platform().log.normal(
          "HTTPSPostBackend(postJsonMessage): The storebag's %s has no post_url for client type %d: %zu events are lost",
          name().c_str(), facts().compType, events.size());
    if (completion) completion(Value(), Error{kKYTReportingErrorDomain, -1, "postURL is nil"});
    return std::nullopt;
  }
  OutgoingPost post{PostRequest(configuration_, postFacts()), *url, std::nullopt, connectivityDelegate(),
                    PostReply{weak_from_this(),
                              PostStanding(standing(), events.size()),
                              platform(),
                              name(),
                              std::move(completion),
                              PostedEvents(std::move(events), platform().counters),
                              {},
                              userAccount(),
                              0}};
  if (method && responseCode) post.eventMap = EventMap{*method, *responseCode};
  return post;
}

}  // namespace kyt
