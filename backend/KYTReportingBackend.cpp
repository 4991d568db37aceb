#include "backend/KYTReportingBackend.h"

#include <algorithm>
#include <vector>

#include "backend/PersistentIdentifier.h"
#include "backend/Text.h"
#include "platform/Cryptography.h"
#include "platform/Platform.h"
#include "platform/RandomSource.h"
#include "platform/base/Counters.h"
#include "platform/base/Hex.h"
#include "platform/base/UserBudget.h"
#include "platform/queues/SerialQueue.h"

namespace kyt {

bool holdsCategory(const Array& list, uint16_t category) {
  return std::any_of(list.begin(), list.end(),
                     [category](const Value& entry) { return entry.intValue() == category; });
}

std::shared_ptr<KYTReportingBackend> KYTReportingBackend::initWithName(Platform& platform, String name,
                                                                       Dictionary profile,
                                                                       SharedSessionFacts facts) {
  return std::make_shared<KYTReportingBackend>(Making(), platform, std::move(name), std::move(profile),
                                               std::move(facts));
}

KYTReportingBackend::KYTReportingBackend(Making, Platform& platform, String name, Dictionary profile,
                                         SharedSessionFacts facts)
    : platform_(platform),
      name_(std::move(name)),
      profile_(std::move(profile)),
      facts_(std::move(facts)),
      samplingFactor_(platform.random.uniform(101) / 100.0),
      stateQueue_(SerialQueue::create("com.vantu.KYTReportingBackendStateQueue", platform.executor)),
      standing_(std::make_shared<BackEndStanding>(name_.str())),
      batchEvents_(facts_->batchEvents) {}

KYTReportingBackend::~KYTReportingBackend() {
  drainStateQueue();
}

void KYTReportingBackend::drainStateQueue() {
  stateQueue_->sync([] {});
}

String KYTReportingBackend::convertIntoSHA256(const String& text) const {
  const Bytes bytes = std::as_bytes(std::span(text.view()));
  const auto digest = platform_.cryptography.sha256(bytes.first(std::min(text.utf16Length(), bytes.size())));
  std::string hex;
  hex.reserve(2 * digest.size());
  appendHex(digest, hex);
  return String(hex);
}

void KYTReportingBackend::cleanup() {}

void KYTReportingBackend::setReportingSessionConnectivityDelegate(
    std::weak_ptr<ReportingSessionConnectivityInterface> delegate) {
  reportingSessionConnectivityDelegate_ = std::move(delegate);
}

void KYTReportingBackend::setProgram(std::shared_ptr<const ReportingProgram> program) {
  if (tally_ != nullptr) drainStateQueue();
  tally_ = nullptr;
  tallies_ = {};
  program_ = std::move(program);
}

void KYTReportingBackend::tellOwner(DepartureKind kind, std::string_view address, size_t bytes,
                                    const URLReply& reply) const {
  if (!mayHaveLeft(reply.response, reply.error)) return;
  platform_.departures.add({.program = program_ != nullptr ? *program_ : ReportingProgram(),
                            .server = serverOf(address),
                            .kind = kind,
                            .events = 0,
                            .bytes = bytes,
                            .isAnswered = reply.response.has_value()});
}

void KYTReportingBackend::takeEvent(bool isInternal, EventKind kind) {
  kind_ = kind;
  std::shared_ptr<Tally>& tally = tallies_[isInternal ? 1 : 0];
  if (tally == nullptr && program_ != nullptr)
    tally = platform_.books.open(*program_, name_.view(), isInternal);
  tally_ = tally.get();
  if (tally_ != nullptr) tally_->take();
}

void KYTReportingBackend::dropEvent(Tally* tally, EventKind kind, Reason fate) const {
  platform_.counters.add(fate);
  if (tally == nullptr) return;
  tally->drop(fate, 1);
  if (platform_.books.watchers()->anybody()) tellWatchers(*tally, kind, fate);
}

void KYTReportingBackend::eventDelivered() const {
  if (tally_ == nullptr) return;
  tally_->deliver(1);
  if (platform_.books.watchers()->anybody()) tellWatchers(*tally_, kind_, std::nullopt);
}

void KYTReportingBackend::tellWatchers(const Tally& tally, EventKind kind,
                                       std::optional<Reason> dropped) const {
  Watchers& watchers = *platform_.books.watchers();
  if (!watchers.want(tally.program(), kind)) return;
  PassedEvent event = tally.passed(kind, dropped);
  event.backEnd = name_.str();
  if (dropped) event.rule = ruleFor(*dropped, kind);
  watchers.tell(std::move(event));
}

const char* KYTReportingBackend::ruleFor(Reason fate, EventKind kind) const {
  switch (fate) {
    case Reason::eventFiltered:
    case Reason::batchedEventFiltered:
      return isWhitelistedEvent(static_cast<uint16_t>(kind.category)) ? "black-list" : "white-list";
    case Reason::eventDroppedByState:
    case Reason::batchDiscarded: {
      const StateRule rule = standing_->state().rule;
      return rule != StateRule::none ? stateRuleName(rule) : "";
    }
    default:
      return "";
  }
}

int32_t KYTReportingBackend::state() const {
  return stateQueue_->sync([this] {
    stateQueue_->assertCurrent();
    return state_;
  });
}

void KYTReportingBackend::setState(int32_t state, StateRule rule, int status) {
  const auto now = static_cast<uint32_t>(platform_.clock.timeOfDay().asSeconds());
  const BackEndStanding::State shown{static_cast<uint8_t>(state), rule, static_cast<uint16_t>(status), now};
  stateQueue_->async([this, state, shown] {
    stateQueue_->assertCurrent();
    state_ = state;
    standing_->setState(shown);
  });
}

void KYTReportingBackend::updateState() {
  setState(kBackendStateEnabled);
}

Value KYTReportingBackend::sendMessage(Dictionary, const TimeValue&, uint16_t, uint16_t, EventID,
                                       MessageFlag) {
  dropEvent(Reason::notForThisBackEnd);
  return {};
}

Value KYTReportingBackend::sendMessage(const Dictionary&, const TimeValue&, uint16_t, uint16_t, EventID) {
  platform_.counters.add(Reason::notForThisBackEnd);
  return {};
}

Value KYTReportingBackend::sendMessage(Dictionary message, const TimeValue& timestamp, uint16_t method,
                                       uint16_t respCode, MessageFlag flag) {
  ++eventID_;
  return sendMessage(std::move(message), timestamp, method, respCode, EventID{eventID_}, flag);
}

Value KYTReportingBackend::flushMessagesWithCompletion(FlushCompletion completion) {
  if (completion) completion(Value(), std::nullopt);
  return {};
}

bool KYTReportingBackend::uploadFileAtPath(const String&, const String&, FileOffer&) {
  return false;
}

bool KYTReportingBackend::uploadLogData(const Value&) {
  return false;
}

void KYTReportingBackend::setCorrelatedSessionID(const SessionIDPath& sessionID) {
  stateQueue_->sync([&] {
    stateQueue_->assertCurrent();
    combinedSessionID_ = sessionID;
  });
}

bool KYTReportingBackend::isWhitelistedEvent(uint16_t category) const {
  // Deliberately not the mirror image of the black list: an empty white list blocks every event.
  return !eventWhitelist_ || holdsCategory(*eventWhitelist_, category);
}

bool KYTReportingBackend::isBlacklistedEvent(uint16_t category) const {
  return eventBlacklist_ && holdsCategory(*eventBlacklist_, category);
}

uint64_t KYTReportingBackend::batchedEventsSize() {
  return 0;
}

std::optional<String> KYTReportingBackend::combinedSessionIDString() const {
  const std::optional<SessionIDPath> path = stateQueue_->sync([this] {
    stateQueue_->assertCurrent();
    return combinedSessionID_;
  });
  return path ? std::optional<String>(path->text()) : std::nullopt;
}

void KYTReportingBackend::setCombinedSessionIDString(std::optional<String> value) {
  std::optional<SessionIDPath> path;
  if (value) path = SessionIDPath(std::move(*value));
  stateQueue_->sync([&] {
    stateQueue_->assertCurrent();
    combinedSessionID_ = std::move(path);
  });
}

Value KYTReportingBackend::samplingThreshold() const {
  return stateQueue_->sync([this] {
    stateQueue_->assertCurrent();
    return samplingThreshold_;
  });
}

void KYTReportingBackend::setSamplingThreshold(Value value) {
  stateQueue_->sync([&] {
    stateQueue_->assertCurrent();
    samplingThreshold_ = std::move(value);
  });
}

String KYTReportingBackend::getPersistentIdentifierForDNU(bool respectDnu) {
  return persistentIdentifier(platform_, userAccount_ ? std::optional(userAccount_->user()) : std::nullopt,
                              respectDnu ? "uuidRespectDnu" : "uuidOverrideDnu");
}

}  // namespace kyt
