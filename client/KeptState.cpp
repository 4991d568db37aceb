#include "client/KeptState.h"

namespace kyt::client {

namespace {

constexpr int64_t kFirstTypeWithStorebag = 5;

std::string textAt(const std::optional<Dictionary>& dictionary, const char* key) {
  const Value* value = dictionary ? dictionary->find(key) : nullptr;
  return value != nullptr ? "\"" + description(*value) + "\"" : "none";
}

}  // namespace

void KeptState::takeOver(const Call& sent) {
  if (sent.method == Method::startConfigWithCompletionHandler) configured_ = true;
  std::visit([this](const auto& arguments) { take(arguments); }, sent.arguments);
}

// None leaves what was promised, and takes away what was not.
void KeptState::take(const UserInfoArguments& sent) {
  if (sent.userInfo || !promisesUserInfo()) identity_.userInfo = sent.userInfo;
}

// A null is left out on the way to the daemon, where the former value stays.
void KeptState::take(const SharedDataArguments& sent) {
  for (const DictionaryEntry& entry : sent.entries)
    if (!entry.value.isNull()) sharedData_.set(entry.key, entry.value);
}

void KeptState::take(const SharedDataForKeyArguments& sent) {
  if (sent.value.isNull())
    sharedData_.remove(sent.key.view());
  else
    sharedData_.set(sent.key, sent.value);
}

bool KeptState::promisesUserInfo() const {
  const Value* required = identity_.sessionInfo.find(kKYTReportingSessionInfoRequireUserInfo);
  return required != nullptr && required->boolValue();
}

std::string KeptState::whyNoStorebag() const {
  const Value* type = identity_.sessionInfo.find(kKYTReportingSessionInfoClientType);
  if (type == nullptr) return "the session's information has no ClientType, so there is no storebag for it";
  const std::string number = description(*type);
  if (type->longLongValue() < kFirstTypeWithStorebag)
    return "client type " + number + " has no storebag: types 5 to 23 have one";
  return "the daemon has no storebag for client type " + number +
         ", or one that names no back end: its log says why it could not be fetched or verified, or that it names none";
}

std::string KeptState::whyNotLive() const {
  const bool promised = promisesUserInfo();
  if (promised && (!identity_.userInfo || identity_.userInfo->empty()))
    return "RequireUserInfo is set, and the session has no user information";
  return "no entry of the storebag is switched on for ClientName " +
         textAt(identity_.userInfo, kKYTReportingUserInfoClientName) + ", ServiceName " +
         textAt(identity_.userInfo, kKYTReportingUserInfoServiceName) +
         ": none has these names, or the entry that has leaves out this country or device or lacks filters or "
         "sampling_threshold" +
         (promised ? ", or the owner's consent is not given" : "");
}

}  // namespace kyt::client
