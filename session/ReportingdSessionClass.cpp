#include "session/ReportingdSessionClass.h"

#include "backend/BackendFactory.h"
#include "config/DeviceIdentity.h"
#include "platform/Platform.h"
#include "platform/base/Clock.h"
#include "platform/base/Counters.h"
#include "platform/objects/Keys.h"
#include "platform/queues/Log.h"
#include "session/MessageLog.h"
#include "session/ReportingSessionConnectivityHelper.h"

namespace kyt {

namespace {

// Nobody waits for what the back ends return for a single message.
class MessageLogReader final : public AnswerReader {
 public:
  MessageLogReader(MessageLog& messageLog, uint32_t user) : messageLog_(messageLog), user_(user) {}
  bool wantsAnswer(size_t leastBytes) override { return messageLog_.takesLine(user_, leastBytes); }

 private:
  MessageLog& messageLog_;
  const uint32_t user_;
};

}  // namespace

ReportingProgram programOf(uint32_t user, int32_t clientType, const std::optional<Dictionary>& userInfo) {
  const auto name = [&userInfo](const char* key) {
    const Value* value = userInfo ? userInfo->find(key) : nullptr;
    const String* text = value != nullptr ? value->string() : nullptr;
    return text != nullptr ? text->str() : std::string();
  };
  return {user, clientType, name(kKYTReportingUserInfoClientName), name(kKYTReportingUserInfoServiceName)};
}

ReportingdSessionClass::ReportingdSessionClass(Configuration configuration, BackendFactory& backendFactory,
                                               MessageLog& messageLog)
    : configuration_(configuration), backendFactory_(backendFactory), messageLog_(messageLog) {}

ReportingdSessionClass::~ReportingdSessionClass() = default;

std::shared_ptr<ReportingSessionConnectivityHelper> ReportingdSessionClass::singleMessageHelper() {
  MutexLock lock(lock_);
  if (singleMessageHelper_ == nullptr)
    singleMessageHelper_ = ReportingSessionConnectivityHelper::init(platform().urlSessions);
  return singleMessageHelper_;
}

void ReportingdSessionClass::tellWatchers(const Tally& tally, EventKind kind, Reason fate) const {
  const std::shared_ptr<Watchers>& watchers = platform().books.watchers();
  if (!watchers->anybody() || !watchers->want(tally.program(), kind)) return;
  PassedEvent event = tally.passed(kind, fate);
  event.backEnd = kNoBackEnd;
  watchers->tell(std::move(event));
}

void ReportingdSessionClass::dropEvent(const ReportingProgram& program, EventKind kind, Reason fate) const {
  platform().counters.add(fate);
  const std::shared_ptr<Tally> tally = platform().books.open(program, kNoBackEnd, false);
  tally->take();
  tally->drop(fate, 1);
  tellWatchers(*tally, kind, fate);
}

void ReportingdSessionClass::tellFiltered(const KYTReportingBackend& backend, uint16_t category) const {
  const std::string name = backend.name().str();
  backend.dropEvent(Reason::eventFiltered);
  if (platform().counters.mayTell(Reason::eventFiltered, name + std::to_string(category),
                                  platform().clock.monotonic()))
    platform().log.normal(
        "sendMessageWithSessionInfo: A message was dropped: the lists of the back end %s keep category %d away",
        name.c_str(), category);
}

// Deliberately unlike the session's own door: each back end works out its state first, gets the bare payload
// without an envelope or shared data, with the serial number on internal builds, and always the flag 0;
// nothing is aggregated.
void ReportingdSessionClass::sendMessageWithSessionInfo(
    uint32_t user, const std::optional<Dictionary>& sessionInfo, const std::optional<Dictionary>& userInfo,
    const std::optional<Dictionary>& storebag, uint16_t category, uint16_t type,
    const std::optional<Dictionary>& payload, const std::shared_ptr<UserAccount>& account) {
  Log& log = platform().log;
  const Value* sessionID = sessionInfo ? sessionInfo->find(kKYTReportingSessionInfoSessionID) : nullptr;
  log.debug("sendMessageWithSessionInfo: Sending single message with sessionID %ld",
            static_cast<long>(sessionID != nullptr ? sessionID->longLongValue() : 0));
  const Value* clientType = sessionInfo ? sessionInfo->find(kKYTReportingSessionInfoClientType) : nullptr;
  const auto program = std::make_shared<const ReportingProgram>(
      programOf(user, clientType != nullptr ? clientType->intValue() : 0, userInfo));
  if (!sessionInfo || !storebag) {
    // The leading "R" is part of the message that tools look for.
    log.error("RsendMessageWithSessionInfo: Attempted to send message with one or more nil parameters");
    dropEvent(*program, {category, type}, storebag ? Reason::identifiersMissing : Reason::noStorebag);
    return;
  }
  char deviceID[kDeviceIDSize] = {};
  deviceIdentity().deviceUniqueIDCString(deviceID, kDeviceIDSize);
  MessageLogReader reader(messageLog_, user);
  const std::optional<Backends> backends =
      backendFactory_.createBackends(storebag, sessionInfo, userInfo, deviceID);
  if (!backends || backends->empty()) {
    log.error("sendMessageWithSessionInfo: No backends available to send single message");
    dropEvent(*program, {category, type}, Reason::noBackEnds);
    return;
  }
  if (userInfo && !sessionInfo->boolean(kKYTReportingSessionInfoRequireUserInfo))
    log.error("sendMessageWithSessionInfo: user info provided without requiring it.");

  const std::shared_ptr<ReportingSessionConnectivityHelper> helper = singleMessageHelper();
  const TimeValue timestamp = platform().clock.timeOfDay();
  for (const auto& [key, backend] : *backends) {
    backend->setUserAccount(account);
    backend->setAnswerReader(&reader);
    backend->setProgram(program);
    backend->takeEvent(false, {category, type});
    backend->updateState();
    backend->setReportingSessionConnectivityDelegate(helper);
    if (!backend->isWhitelistedEvent(category)) {
      log.debug(
          "sendMessageWithSessionInfo: Dropping event with category %d as it is not whitelisted for backend %s",
          category, backend->name().c_str());
      tellFiltered(*backend, category);
      continue;
    }
    if (backend->isBlacklistedEvent(category)) {
      log.debug(
          "sendMessageWithSessionInfo: Dropping event with category %d as it is blacklisted for backend %s",
          category, backend->name().c_str());
      tellFiltered(*backend, category);
      continue;
    }
    Dictionary message = payload.value_or(Dictionary());
    if (deviceIdentity().isInternalBuild())
      message.set("SerialNum", deviceIdentity().serialNumber().value_or("Unknown"));
    const Value answer = backend->sendMessage(std::move(message), timestamp, category, type, MessageFlag{0});
    if (!answer.isNull())
      messageLog_.writeToLogFile(user, "[%@ -> sendMessageWithSessionInfo] %@", {key, answer});
  }
  for (const auto& [key, backend] : *backends) backend->cleanup();
}

}  // namespace kyt
