#include "backends/https/HTTPSPostBackend.h"

#include "platform/DeviceProperties.h"
#include "platform/Platform.h"
#include "platform/UserDefaults.h"
#include "platform/base/Counters.h"
#include "platform/objects/Description.h"
#include "platform/objects/Keys.h"
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

}  // namespace

std::shared_ptr<HTTPSPostBackend> HTTPSPostBackend::initWithName(Configuration& configuration,
                                                                 const std::optional<String>& name,
                                                                 const std::optional<Dictionary>& profile,
                                                                 SharedSessionFacts facts) {
  if (!name || !profile) return nullptr;
  const Value* clients = profile->find("clients");
  if (clients == nullptr || !clients->isArray()) {
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
      reportVersion_(formattedReportVersion()) {
  readUserDefaults();
  if (const Value* displayURL = this->profile().find("display_url"); displayURL != nullptr)
    if (const String* text = displayURL->string()) setDisplayURL(*text);
  dnuEnabled_ = platform().consent.isSubmissionAllowed();
  uuidRespectDnu_ = getPersistentIdentifierForDNU(true);
  uuidOverrideDnu_ = getPersistentIdentifierForDNU(false);
}

HTTPSPostBackend::~HTTPSPostBackend() {
  drainStateQueue();
  // What no flush took is lost with the session. Nobody else can reach the batch any more.
  giveBackToUser(batchedBytes_);
  if (!batchedEvents_) return;
  platform().counters.add(Reason::batchDiscarded, batchedEvents_->size());
  tellDiscarded(batchedEvents_->size(),
                facts().requireUserInfo && !hasUserInfo() ? "user information was promised and is missing"
                : stateOnQueue() == kBackendStateEnabled
                    ? "a single message was batched, since its client entry has \"expedite\" 0"
                    : "the back end was not enabled");
}

void HTTPSPostBackend::readUserDefaults() {
  UserDefaults& defaults = platform().userDefaults;
  const Value post = defaults.value(kKYTReportingDefaultsDomain, "httpsPostURL");
  if (const String* url = post.string()) {
    platform().log.debug("HTTPSPostBackend(initWithName): Using user default '%s' for postURL", url->c_str());
    postURL_ = *url;
    useDefaultPostURL_ = true;
  }
  const Value realtime = defaults.value(kKYTReportingDefaultsDomain, "httpsRealtimePostURL");
  if (const String* url = realtime.string()) {
    platform().log.debug("HTTPSPostBackend(initWithName): Using user default '%s' for realtimePostURL",
                         url->c_str());
    realtimePostURL_ = *url;
    useDefaultRealtimePostURL_ = true;
  }
  forceEventLogging_ = defaults.value(kKYTReportingDefaultsDomain, "forceEventLogging").boolValue();
}

const String* HTTPSPostBackend::userInfoText(const char* key) const {
  const Value* value = userInfoDict() ? userInfoDict()->find(key) : nullptr;
  return value != nullptr ? value->string() : nullptr;
}

Dictionary HTTPSPostBackend::takePayload(Dictionary& message) const {
  // The single-message door sends the bare payload.
  if (!message.contains(kKYTReportingMessageBlobClientData)) return message;
  Value clientData = message.take(kKYTReportingMessageBlobClientData);
  if (Dictionary* payload = clientData.mutableDictionary()) return std::move(*payload);
  platform().log.error("HTTPSPostBackend(sendMessage): SESSION_TYPE_STOP message dictionary is nil");
  return {};
}

void HTTPSPostBackend::addStopEntries(Dictionary& payload) const {
  platform().log.debug(
      "HTTPSPostBackend(sendMessage): Adding dnu type and sampling threshold to SESSION_TYPE_STOP message dictionary");
  payload.set("Opt", dnuType_);
  payload.set("SamplingThreshold", numberOrMinusOne(samplingThreshold()));
  payload.set("OverrideSampling", numberOrMinusOne(overrideSampling_));
  payload.set("Batch", batchEvents() ? 1u : 0u);
}

Value HTTPSPostBackend::sendMessage(Dictionary message, const TimeValue& timestamp, uint16_t method,
                                    uint16_t respCode, EventID, MessageFlag flag) {
  const Shared now = stateQueue().sync([this] { return Shared{stateOnQueue(), combinedSessionIDOnQueue()}; });
  const int32_t oldState = now.state;
  if (oldState == kBackendStateDisabled) {
    platform().counters.add(Reason::eventDroppedByState);
    return {};
  }
  Dictionary payload = takePayload(message);
  if (isSessionStop(method, respCode)) addStopEntries(payload);
  const Value* shared = message.find(kKYTReportingMessageBlobSharedData);
  const Dictionary* frameworkData = shared != nullptr ? shared->dictionary() : nullptr;
  std::optional<String> sessionID;
  if (now.sessionID) sessionID = now.sessionID->text();
  Dictionary record = makeRecord(std::move(payload), timestamp, method, respCode, sessionID,
                                 frameworkData != nullptr ? frameworkData->size() : 0);
  prepareEventForMessage(record, frameworkData);
  // This message is deliberately still handled with the old state: it is the last of the batch that it frees.
  if (isExpedite(flag) && oldState == kBackendStateHeld) setState(kBackendStateEnabled);
  platform().log.debug("HTTPSPostBackend(sendMessage): realtime is %d", isRealtime(flag));
  const bool undecided = oldState == kBackendStateUndecided || oldState == kBackendStateHeld;
  if (undecided || (!isRealtime(flag) && batchEvents()) || (facts().requireUserInfo && !hasUserInfo())) {
    platform().log.debug("HTTPSPostBackend(sendMessage): Batching %d, %d, %d", oldState, batchEvents(),
                         facts().requireUserInfo);
    return batchEvent(std::move(record));
  }
  return sendStandalone(std::move(record), oldState, method, respCode, flag);
}

Value HTTPSPostBackend::sendStandalone(Dictionary record, int32_t state, uint16_t method, uint16_t respCode,
                                       MessageFlag flag) {
  Value flushed;
  if (state == kBackendStateEnabled && isRealtime(flag) &&
      stateQueue().sync([this] { return batchedEvents_.has_value(); })) {
    platform().log.debug(
        "HTTPSPostBackend(sendMessage): Got a realtime event and some events have already been batched. Forcing Flush here to keep events in order.");
    flushed = flushMessagesWithCompletion(nullptr);
  }
  platform().log.debug("HTTPSPostBackend(sendMessage): Sending %d, %d, %d", state, batchEvents(),
                       facts().requireUserInfo);
  Array records;
  records.append(Value(std::move(record)));
  Value text;
  size_t events = 0;
  std::optional<std::string> json = createMessageForPostAndLogging(std::move(records), &text, &events);
  if (!json) return {};
  if (!flushed.isNull()) {
    text = Value(formatObjects("Flushed events:\n%@\nStandalone event:\n%@", {flushed, text}));
    immutable_ = true;
  }
  postJSONMessage(std::move(*json), flag, method, respCode, nullptr, events);
  return text;
}

}  // namespace kyt
