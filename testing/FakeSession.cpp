#include "testing/FakeSession.h"

#include <algorithm>
#include <utility>

#include "config/ClientTypes.h"
#include "platform/base/Hex.h"
#include "platform/objects/Keys.h"

namespace kyt::testing {

namespace {
constexpr uint32_t kRealtime = 1;  // of a message's flags
}  // namespace

Event FakeSession::event(Kind kind) const {
  Event made;
  made.kind = kind;
  made.connection = number_;
  return made;
}

bool FakeSession::hasStorebag(const Dictionary& info) const {
  return states_ && storebagNameForClientType(info.integer(kKYTReportingSessionInfoClientType)).has_value();
}

bool FakeSession::has(std::initializer_list<const char*> backEnds) const {
  return isConfigured_ && std::ranges::any_of(*states_, [backEnds](const Value& name) {
           return name.string() != nullptr && std::ranges::any_of(backEnds, [&name](const char* backEnd) {
                    return *name.string() == backEnd;
                  });
         });
}

bool FakeSession::takesUploads() const {
  return has({kKYTReportingBackendUploadServer});
}

bool FakeSession::keepsBatches() const {
  return has({kKYTReportingBackendHTTPPost, kKYTReportingBackendHTTPPost2, kKYTReportingBackendQRS});
}

void FakeSession::setSessionInfo(Dictionary info, std::optional<Dictionary> user, Value /*frameworks*/,
                                 bool aggregates) {
  Event made = event(Kind::session);
  made.sessionInfo = std::move(info);
  made.userInfo = std::move(user);
  made.aggregates = aggregates;
  hasStorebag_ = hasStorebag(made.sessionInfo);
  batches_ = made.sessionInfo.boolean(kKYTReportingSessionInfoBatchEvent);
  aggregators_->add(made, connection_);
  note(std::move(made));
}

void FakeSession::startConfigWithCompletionHandler(StatesReply reply) {
  if (!note(event(Kind::configuration))) return keep(std::move(reply));
  isConfigured_ = isConfigured_ || hasStorebag_;
  // The session's start message is an event like others.
  pending_ = batches_ && keepsBatches();
  reply(hasStorebag_ ? states_ : std::nullopt);
}

void FakeSession::fetchStatesWithUserInfo(std::optional<Dictionary> user, StatesReply reply) {
  Event made = event(Kind::states);
  made.userInfo = std::move(user);
  if (!note(std::move(made))) return keep(std::move(reply));
  reply(isConfigured_ ? states_ : std::nullopt);
}

void FakeSession::fetchDisplayURL(StringReply reply) {
  if (!records_->isAlive()) return keep(std::move(reply));
  reply("URL not available");
}

void FakeSession::sendMessageWithDictionary(Dictionary message, ObjectReply reply) {
  Event made = event(Kind::message);
  made.category = static_cast<uint16_t>(message.unsignedInteger(kKYTReportingMessageParametersCategory));
  made.type = static_cast<uint16_t>(message.unsignedInteger(kKYTReportingMessageParametersType));
  made.flag = message.unsignedInteger(kKYTReportingMessageParametersFlag);
  if (const Dictionary* payload = message.dictionary(kKYTReportingMessageParametersPayload))
    made.payload = *payload;
  made.dropped = !isConfigured_;
  const bool isRealtime = (made.flag & kRealtime) != 0;  // what was batched goes before it
  pending_ = !isRealtime && (pending_ || (batches_ && keepsBatches()));
  const bool noted = note(made);
  if (noted && !made.dropped) aggregators_->offer(made);
  if (!reply) return;
  if (!noted || !records_->isAlive()) return keep(std::move(reply));
  reply(Value());
}

void FakeSession::flushMessagesWithCompletion(ResultReply completion) {
  if (!note(event(Kind::flush))) return keep(std::move(completion));
  if (!isConfigured_)
    return completion(Value(), Error{kKYTReportingErrorDomain, -1, "No backends available to send message"});
  // Back ends that never batch have nothing against it.
  const bool noneBatches = !states_->empty() && !keepsBatches();
  if (std::exchange(pending_, false) || noneBatches) return completion(Value(), std::nullopt);
  completion(Value(), Error{kKYTReportingErrorDomain, -1, "Nothing to flush"});
}

void FakeSession::finishSessionGracefully() {
  note(event(Kind::finish));
}

void FakeSession::uploadFileAtPath(String url, String /*token*/, std::optional<FileExtension> extension,
                                   SuccessReply reply) {
  Event made = event(Kind::file);
  made.text = url.str();
  if (!note(std::move(made))) return keep(std::move(reply));
  reply(extension.has_value() && takesUploads());
}

void FakeSession::uploadLogData(Value data, SuccessErrorReply reply) {
  Event made = event(Kind::logData);
  made.payload.set("logData", std::move(data));
  if (!note(std::move(made))) return keep(std::move(reply));
  reply(takesUploads(), std::nullopt);
}

void FakeSession::sendMessageWithSessionInfo(Dictionary info, std::optional<Dictionary> user,
                                             uint16_t category, uint16_t type,
                                             std::optional<Dictionary> payload, StringReply reply) {
  if (!info.contains(kKYTReportingSessionInfoClientType) ||
      !info.contains(kKYTReportingSessionInfoSessionID)) {  // the daemon drops the message
    if (!records_->isAlive()) return keep(std::move(reply));
    if (reply) reply("Could not retrieve identifiers from sessionInfo");
    return;
  }
  const bool finds = hasStorebag(info);
  Event made = event(Kind::message);
  made.single = true;
  made.dropped = !finds;
  made.category = category;
  made.type = type;
  made.sessionInfo = std::move(info);
  made.userInfo = std::move(user);
  if (payload) made.payload = *std::move(payload);
  if (!note(std::move(made)) || !records_->isAlive()) return keep(std::move(reply));
  reply(finds ? "finished" : "storebag not available");
}

void FakeSession::updateSharedDataWithDictionary(Dictionary data) {
  Event made = event(Kind::sharedData);
  made.payload = std::move(data);
  note(std::move(made));
}

void FakeSession::updateSharedDataForKey(String key, Value value) {
  Event made = event(Kind::sharedData);
  made.payload.set(std::move(key), std::move(value));
  note(std::move(made));
}

void FakeSession::setDigestKey(Data key, int32_t /*algorithm*/) {
  Event made = event(Kind::digestKey);
  appendHex(key.bytes(), made.text);
  note(std::move(made));
}

}  // namespace kyt::testing
