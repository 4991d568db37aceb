#include "client/Kept.h"

namespace kyt::client {

namespace {

constexpr int64_t kFirstTypeWithStorebag = 5;

std::string textAt(const std::optional<Dictionary>& dictionary, const char* key) {
  const Value* value = dictionary ? dictionary->find(key) : nullptr;
  return value != nullptr ? "\"" + description(*value) + "\"" : "none";
}

}  // namespace

void Kept::takeOver(const Command& sent) {
  switch (sent.kind) {
    case Command::Kind::startConfiguration:
      configured = true;
      return;
    case Command::Kind::fetchStates:
      // None leaves what was promised, and takes away what was not.
      if (sent.dictionary || !promisesUserInfo()) userInfo = sent.dictionary;
      return;
    case Command::Kind::updateSharedData:
      // A null is left out on the way to the daemon, where the former value stays.
      for (const DictionaryEntry& entry : *sent.dictionary)
        if (!entry.value.isNull()) sharedData.set(entry.key, entry.value);
      return;
    case Command::Kind::updateSharedDataForKey:
      if (sent.value.isNull())
        sharedData.remove(sent.text.view());
      else
        sharedData.set(sent.text, sent.value);
      return;
    case Command::Kind::setDigestKey:
      digestKey = sent.data;
      digestAlgorithm = sent.algorithm;
      return;
    default:
      return;
  }
}

bool Kept::promisesUserInfo() const {
  const Value* required = sessionInfo.find(kKYTReportingSessionInfoRequireUserInfo);
  return required != nullptr && required->boolValue();
}

std::string Kept::whyNoStorebag() const {
  const Value* type = sessionInfo.find(kKYTReportingSessionInfoClientType);
  if (type == nullptr) return "the session's information has no ClientType, so there is no storebag for it";
  const std::string number = description(*type);
  if (type->longLongValue() < kFirstTypeWithStorebag)
    return "client type " + number + " has no storebag: types 5 to 23 have one";
  return "the daemon has no storebag for client type " + number +
         ", or one that names no back end: its log says why it could not be fetched or verified, or that it names none";
}

std::string Kept::whyNotLive() const {
  const bool promised = promisesUserInfo();
  if (promised && (!userInfo || userInfo->empty()))
    return "RequireUserInfo is set, and the session has no user information";
  return "no entry of the storebag is switched on for ClientName " +
         textAt(userInfo, kKYTReportingUserInfoClientName) + ", ServiceName " +
         textAt(userInfo, kKYTReportingUserInfoServiceName) +
         ": none has these names, or the entry that has leaves out this country or device or lacks filters or "
         "sampling_threshold" +
         (promised ? ", or the owner's consent is not given" : "");
}

}  // namespace kyt::client
