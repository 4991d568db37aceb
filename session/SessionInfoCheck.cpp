#include "session/SessionInfoCheck.h"

#include <algorithm>
#include <span>
#include <string_view>

#include "platform/Clock.h"
#include "platform/Counters.h"
#include "platform/Keys.h"
#include "platform/Log.h"
#include "platform/Platform.h"
#include "platform/Value.h"

namespace kyt {

namespace {

bool isNumber(const Value& value) {
  return value.isNumber() && value.kind() != Value::Kind::boolean;
}
bool isTruth(const Value& value) {
  return value.isNumber();
}
bool isText(const Value& value) {
  return value.string() != nullptr;
}
bool isToken(const Value& value) {
  return value.isDictionary();
}

struct Known {
  std::string_view key;
  bool (*isOfItsType)(const Value& value);
};

constexpr Known kSessionInfo[] = {
    {kKYTReportingSessionInfoSessionID, isNumber},      {kKYTReportingSessionInfoClientType, isNumber},
    {kKYTReportingSessionInfoClientVersion, isNumber},  {kKYTReportingSessionInfoBatchEvent, isTruth},
    {kKYTReportingSessionInfoRequireUserInfo, isTruth}, {kKYTReportingSessionInfoHierarchyToken, isToken},
};
constexpr Known kToken[] = {
    {kKYTReportingHierarchyTokenLevel, isNumber},
    {kKYTReportingHierarchyTokenTokenID, isText},
};

void count(const Dictionary& dictionary, std::span<const Known> known, Platform& platform) {
  for (const DictionaryEntry& entry : dictionary) {
    const auto found = std::find_if(known.begin(), known.end(),
                                    [&](const Known& one) { return entry.key.view() == one.key; });
    if (found != known.end() && found->isOfItsType(entry.value)) continue;
    const bool isUnknown = found == known.end();
    const Reason reason = isUnknown ? Reason::sessionInfoKeyUnknown : Reason::sessionInfoValueMistyped;
    if (platform.counters.addAndMayLog(reason, platform.clock.monotonic()))
      platform.log.normal(
          isUnknown ? "setSessionInfo: The session information has an entry %s that means nothing here"
                    : "setSessionInfo: The session information has an entry %s of a wrong type",
          entry.key.c_str());
  }
}

}  // namespace

void countMistakes(const Dictionary& sessionInfo, Platform& platform) {
  count(sessionInfo, kSessionInfo, platform);
  const Value* token = sessionInfo.find(kKYTReportingSessionInfoHierarchyToken);
  if (token != nullptr && token->isDictionary()) count(*token->dictionary(), kToken, platform);
}

}  // namespace kyt
