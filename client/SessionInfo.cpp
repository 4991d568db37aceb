// The check of a session's information. The daemon reads what it finds and takes the rest as absent, so a
// misspelt key, or text where yes or no is meant, would take the session out of the consent's reach without a
// word: what the program means is known here alone.
#include <algorithm>
#include <array>
#include <span>
#include <string>
#include <string_view>
#include <utility>

#include "client/Command.h"
#include "platform/TextEscape.h"

namespace kyt {

namespace {

enum class Kind : uint8_t { boolean, number, text, dictionary };

struct Known {
  const char* key;
  Kind kind;
  uint64_t most;         // of a number
  const char* expected;  // after "is no"
};

constexpr std::array<Known, 6> kSessionInfo{
    {{kKYTReportingSessionInfoSessionID, Kind::number, UINT32_MAX, "whole number from 0 to 4294967295"},
     {kKYTReportingSessionInfoClientType, Kind::number, 23, "whole number from 0 to 23"},
     {kKYTReportingSessionInfoClientVersion, Kind::number, UINT16_MAX, "whole number from 0 to 65535"},
     {kKYTReportingSessionInfoBatchEvent, Kind::boolean, 0, "boolean"},
     {kKYTReportingSessionInfoRequireUserInfo, Kind::boolean, 0, "boolean"},
     {kKYTReportingSessionInfoHierarchyToken, Kind::dictionary, 0, "dictionary"}}};
constexpr std::array<Known, 2> kHierarchyToken{
    {{kKYTReportingHierarchyTokenTokenID, Kind::text, 0, "text"},
     {kKYTReportingHierarchyTokenLevel, Kind::number, UINT32_MAX, "whole number from 0 to 4294967295"}}};

bool isNumberUpTo(const Value& value, uint64_t most) {
  if (const auto number = value.unsignedInteger()) return *number <= most;
  const auto number = value.integer();
  return number && *number >= 0 && static_cast<uint64_t>(*number) <= most;
}

bool fits(const Value& value, const Known& known) {
  switch (known.kind) {
    case Kind::boolean:  // 0 and 1 say the same, and are what languages without booleans have
      return value.boolean().has_value() || isNumberUpTo(value, 1);
    case Kind::number:
      return isNumberUpTo(value, known.most);
    case Kind::text:
      return value.isString();
    case Kind::dictionary:
      return value.isDictionary();
  }
  return false;
}

std::string listOf(std::span<const Known> known) {
  std::string names;
  for (const Known& entry : known) names += (names.empty() ? "" : ", ") + std::string(entry.key);
  return names;
}

// The first problem, or nothing.
std::string problemOf(const Dictionary& dictionary, std::span<const Known> known, const char* what) {
  for (const DictionaryEntry& entry : dictionary) {
    const auto found = std::find_if(known.begin(), known.end(), [&entry](const Known& candidate) {
      return entry.key.view() == candidate.key;
    });
    const std::string name = std::string(what) + ": ";
    const std::string key = "\"" + escapedText(entry.key.view()) + "\"";
    if (found == known.end()) return name + "there is no key " + key + "; there are " + listOf(known);
    if (!fits(entry.value, *found))
      return name + key + " is no " + found->expected + ": " + escapedText(description(entry.value));
  }
  return {};
}

}  // namespace

std::optional<Error> KYTReporting::checkSessionInfo(const Dictionary& sessionInfo) {
  std::string problem = problemOf(sessionInfo, kSessionInfo, "session information");
  if (const Value* token = sessionInfo.find(kKYTReportingSessionInfoHierarchyToken);
      problem.empty() && token != nullptr)
    problem = problemOf(*token->dictionary(), kHierarchyToken, kKYTReportingSessionInfoHierarchyToken);
  if (problem.empty()) return std::nullopt;
  return client::clientError(ClientError::invalid, std::move(problem));
}

Dictionary SessionInfo::dictionary() const {
  Dictionary made{{kKYTReportingSessionInfoSessionID, sessionID},
                  {kKYTReportingSessionInfoClientType, static_cast<unsigned>(clientType)},
                  {kKYTReportingSessionInfoClientVersion, static_cast<unsigned>(clientVersion)},
                  {kKYTReportingSessionInfoBatchEvent, batchEvent},
                  {kKYTReportingSessionInfoRequireUserInfo, requireUserInfo}};
  if (hierarchyToken)
    made.set(kKYTReportingSessionInfoHierarchyToken,
             Dictionary{{kKYTReportingHierarchyTokenTokenID, hierarchyToken->tokenID},
                        {kKYTReportingHierarchyTokenLevel, hierarchyToken->level}});
  return made;
}

}  // namespace kyt
