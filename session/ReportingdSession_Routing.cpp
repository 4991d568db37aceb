// The session's two doors for messages: the one that routes through its configured back ends, which its own
// internal messages take too, and the one for single messages of clients that configure nothing.
#include <utility>

#include "platform/Platform.h"
#include "platform/base/Counters.h"
#include "platform/objects/Keys.h"
#include "platform/queues/Log.h"
#include "session/MessageLog.h"
#include "session/ReportingdSession.h"

namespace kyt {

void ReportingdSession::sendMessageWithDictionary(Dictionary message, ObjectReply reply) {
  log().debug("sendMessageWithDictionary: Sending message for session %u", _sessionID);
  isAnswerAwaited_ = static_cast<bool>(reply);
  Value answer = sendMessageWithDictionaryError(std::move(message));
  isAnswerAwaited_ = false;
  if (reply) reply(std::move(answer));
}

bool ReportingdSession::wantsAnswer(size_t leastBytes) {
  return isAnswerAwaited_ || class_.messageLog().takesLine(peerUser_, leastBytes);
}

namespace {

constexpr int64_t kLast16 = 65535;

std::string whyWithoutBackends(Reason reason) {
  if (reason == Reason::notConfigured) return "it was not configured (StartConfigWithCompletionHandler)";
  return reason == Reason::noStorebag ? "there is no storebag for this client type"
                                      : "the storebag names no back end for it";
}

// What a number's low 16 bits say differs from what was sent.
bool isOdd(const Value& value) {
  if (const auto number = value.integer()) return *number < 0 || *number > kLast16;
  const auto number = value.unsignedInteger();
  return !number || *number > kLast16;
}

EventKind kindOf(const Dictionary& message) {
  const auto number = [&message](const char* key) {
    const Value* value = message.find(key);
    return value != nullptr ? static_cast<int32_t>(value->unsignedIntValue() & 0xffffU) : -1;
  };
  return {number(kKYTReportingMessageParametersCategory), number(kKYTReportingMessageParametersType)};
}

int32_t clientTypeIn(const std::optional<Dictionary>& sessionInfo) {
  return sessionInfo ? sessionInfo->integer(kKYTReportingSessionInfoClientType) : 0;
}

}  // namespace

void ReportingdSession::dropEvent(Reason fate, EventKind kind) {
  std::shared_ptr<Tally>& tally = withoutBackend_[sendsInternalMessage_ ? 1 : 0];
  if (program_ == nullptr) identifyProgram();
  if (tally == nullptr) tally = platform().books.open(*program_, kNoBackEnd, sendsInternalMessage_);
  counters().add(fate);
  tally->take();
  tally->drop(fate, 1);
  class_.tellWatchers(*tally, kind, fate);
}

void ReportingdSession::tellDrop(Reason reason, const std::string& why) {
  const auto bit = static_cast<size_t>(reason);
  if (toldDrops_.test(bit)) return;
  toldDrops_.set(bit);
  const int32_t clientType = clientTypeIn(_sessionInfo);
  const std::string subject = std::to_string(peerUser_) + ":" + std::to_string(clientType) + ":" + why;
  if (!counters().mayTell(reason, subject, platform().clock.monotonic())) return;
  log().normal("sendMessageWithDictionary: Messages of session %u, client type %d, are dropped: %s",
               _sessionID, clientType, why.c_str());
}

// They are taken all the same: the daemon reads leniently.
void ReportingdSession::tellOddNumbers(const Value& category, const Value& type) {
  toldOddNumbers_ = true;
  const int32_t clientType = clientTypeIn(_sessionInfo);
  const std::string subject = "odd:" + std::to_string(peerUser_) + ":" + std::to_string(clientType);
  if (!counters().mayTell(Reason::categoryOrTypeMissing, subject, platform().clock.monotonic())) return;
  log().normal(
      "sendMessageWithDictionary: Session %u, client type %d, sends a Category or Type that is no number up to 65535: "
      "%s and %s are read as %u and %u",
      _sessionID, clientType, kyt::description(category).c_str(), kyt::description(type).c_str(),
      category.unsignedIntValue() & 0xffffU, type.unsignedIntValue() & 0xffffU);
}

Value ReportingdSession::sendMessageWithDictionaryError(Dictionary message) {
  if (!hasBackends()) {
    log().debug("sendMessageWithDictionary: No backends available to send message");
    dropEvent(withoutBackends_, kindOf(message));
    tellDrop(withoutBackends_, whyWithoutBackends(withoutBackends_));
    return nullptr;
  }
  const Value* category = message.find(kKYTReportingMessageParametersCategory);
  if (category == nullptr) {
    log().debug("sendMessageWithDictionary: Missing mandatory parameter 'category'");
    dropEvent(Reason::categoryOrTypeMissing, kindOf(message));
    tellDrop(Reason::categoryOrTypeMissing, "they have no \"Category\" or no \"Type\"");
    return nullptr;
  }
  const Value* type = message.find(kKYTReportingMessageParametersType);
  if (type == nullptr) {
    log().debug("sendMessageWithDictionary: Missing mandatory parameter 'type'");
    dropEvent(Reason::categoryOrTypeMissing, kindOf(message));
    tellDrop(Reason::categoryOrTypeMissing, "they have no \"Category\" or no \"Type\"");
    return nullptr;
  }
  if (!toldOddNumbers_ && (isOdd(*category) || isOdd(*type))) tellOddNumbers(*category, *type);
  const auto method = static_cast<uint16_t>(category->unsignedIntValue());
  const auto respCode = static_cast<uint16_t>(type->unsignedIntValue());
  const auto messageFlag =
      MessageFlag{static_cast<int32_t>(message.unsignedInteger(kKYTReportingMessageParametersFlag))};
  Value payloadValue = message.take(kKYTReportingMessageParametersPayload);
  Dictionary* payload = payloadValue.mutableDictionary();
  const TimeValue timestamp = platform().clock.timeOfDay();

  // Every message, whatever the back ends' lists say of it.
  aggregateMessage(_sessionInfo, timestamp.asSeconds(), method, respCode, payload);
  std::optional<Dictionary> clientData;
  if (payload != nullptr) clientData = std::move(*payload);
  return routeToBackends(envelopeWithPayload(std::move(clientData)), timestamp, method, respCode,
                         messageFlag);
}

Dictionary ReportingdSession::envelopeWithPayload(std::optional<Dictionary> payload) {
  Dictionary envelope;
  // A session without a token never has shared data, so it need not wait for the monitor to learn that.
  if (_hierarchyDictionary) {
    MonitorLock lock(_sessionDelegate.monitor());
    if (std::optional<Dictionary> sharedData = _sessionDelegate.sharedDataForSession(*this))
      envelope.append(kKYTReportingMessageBlobSharedData, std::move(*sharedData));
  }
  if (payload) envelope.append(kKYTReportingMessageBlobClientData, std::move(*payload));
  return envelope;
}

// Not for a session's own start and stop messages, which are events of category 0.
void ReportingdSession::tellFiltered(const KYTReportingBackend& backend, uint16_t category) {
  if (category == 0 || toldDrops_.test(static_cast<size_t>(Reason::eventFiltered))) return;
  tellDrop(Reason::eventFiltered, "the lists of the back end " + backend.name().str() + " keep category " +
                                      std::to_string(category) + " away");
}

Value ReportingdSession::routeToBackends(Dictionary envelope, const TimeValue& timestamp, uint16_t category,
                                         uint16_t type, MessageFlag flag) {
  Value answer;
  size_t left = _backends.size();
  for (const auto& [key, backend] : _backends) {
    --left;
    backend->takeEvent(sendsInternalMessage_, {category, type});
    if (!backend->isWhitelistedEvent(category)) {
      log().debug(
          "sendMessageWithDictionary: Dropping event with category %d as it is not whitelisted for backend %s",
          category, backend->name().c_str());
      backend->dropEvent(Reason::eventFiltered);
      tellFiltered(*backend, category);
      continue;
    }
    if (backend->isBlacklistedEvent(category)) {
      log().debug(
          "sendMessageWithDictionary: Dropping event with category %d as it is blacklisted for backend %s",
          category, backend->name().c_str());
      backend->dropEvent(Reason::eventFiltered);
      tellFiltered(*backend, category);
      continue;
    }
    Value result = backend->sendMessage(left == 0 ? std::exchange(envelope, {}) : envelope, timestamp,
                                        category, type, flag);
    if (result.isNull()) continue;
    class_.messageLog().writeToLogFile(peerUser_, "[%@ -> sendMessageWithDictionary] %@", {key, result});
    const String& name = backend->name();
    if (name == kKYTReportingBackendHTTPPost2 || name == kKYTReportingBackendHTTPPost ||
        (name == kKYTReportingBackendDashboard && answer.isNull()))
      answer = std::move(result);
  }
  figuresMayHaveChanged();
  return answer;
}

// The time stamp is not used: an internal message is stamped anew, like any other.
void ReportingdSession::internalSendMessage(std::optional<Dictionary> payload, const TimeValue& /*timestamp*/,
                                            uint16_t method, uint16_t respCode) {
  Dictionary message{{kKYTReportingMessageParametersCategory, static_cast<unsigned>(method)},
                     {kKYTReportingMessageParametersType, static_cast<unsigned>(respCode)}};
  if (payload) message.set(kKYTReportingMessageParametersPayload, std::move(*payload));
  message.set(kKYTReportingMessageParametersFlag, 0U);
  // Nobody waits for the answer of an internal message.
  sendsInternalMessage_ = true;
  static_cast<void>(sendMessageWithDictionaryError(std::move(message)));
  sendsInternalMessage_ = false;
  log().debug("internalSendMessage: Sent internal message (method:%d respCode:%d)", method, respCode);
}

void ReportingdSession::sendMessageWithSessionInfo(Dictionary sessionInfo, std::optional<Dictionary> userInfo,
                                                   uint16_t category, uint16_t type,
                                                   std::optional<Dictionary> payload, StringReply reply) {
  if (!sessionInfo.contains(kKYTReportingSessionInfoClientType) ||
      !sessionInfo.contains(kKYTReportingSessionInfoSessionID)) {
    log().error("sendMessageWithSessionInfo: Could not retrieve identifiers from sessionInfo");
    dropEvent(Reason::identifiersMissing, {category, type});
    if (reply) reply("Could not retrieve identifiers from sessionInfo");
    return;
  }
  takeOverIdentity(sessionInfo);
  receivedUserInfo(userInfo);
  log().debug("sendMessageWithSessionInfo: Sending message with session info for session %u", _sessionID);
  const std::optional<Dictionary> storebag = _sessionDelegate.storebagForSession(*this);
  if (!storebag) {
    dropEvent(Reason::noStorebag, {category, type});
    tellDrop(Reason::noStorebag, whyWithoutBackends(Reason::noStorebag));
    if (reply) reply("storebag not available");
    return;
  }
  class_.sendMessageWithSessionInfo(peerUser_, sessionInfo, userInfo, storebag, category, type, payload,
                                    userAccount_);
  if (reply) reply("finished");
}

}  // namespace kyt
