// The check of a session's information. The daemon reads what it finds and takes the rest as absent, so a
// misspelt key, or text where yes or no is meant, would take the session out of the consent's reach without a
// word: what the program means is known here alone.
#include <span>
#include <string>
#include <utility>

#include "client/Answer.h"
#include "platform/base/TextEscape.h"
#include "platform/objects/SessionInfoKeys.h"

namespace kyt {

namespace {

using Kind = SessionInfoKey::Kind;

bool isNumberUpTo(const Value& value, uint64_t most) {
  if (const auto number = value.unsignedInteger()) return *number <= most;
  const auto number = value.integer();
  return number && *number >= 0 && static_cast<uint64_t>(*number) <= most;
}

bool fits(const Value& value, const SessionInfoKey& known) {
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

// After "is no".
std::string expected(const SessionInfoKey& known) {
  switch (known.kind) {
    case Kind::boolean:
      return "boolean";
    case Kind::number:
      return "whole number from 0 to " + std::to_string(known.most);
    case Kind::text:
      return "text";
    case Kind::dictionary:
      return "dictionary";
  }
  return {};
}

std::string listOf(std::span<const SessionInfoKey> known) {
  std::string names;
  for (const SessionInfoKey& entry : known) names += (names.empty() ? "" : ", ") + std::string(entry.key);
  return names;
}

// The first problem, or nothing.
std::string problemOf(const Dictionary& dictionary, std::span<const SessionInfoKey> known, const char* what) {
  for (const DictionaryEntry& entry : dictionary) {
    const SessionInfoKey* const found = SessionInfoKey::find(known, entry.key.view());
    const std::string name = std::string(what) + ": ";
    const std::string key = "\"" + escapedText(entry.key.view()) + "\"";
    if (found == nullptr) return name + "there is no key " + key + "; there are " + listOf(known);
    if (!fits(entry.value, *found))
      return name + key + " is no " + expected(*found) + ": " + escapedText(description(entry.value));
  }
  return {};
}

}  // namespace

std::optional<Error> KYTReporting::checkSessionInfo(const Dictionary& sessionInfo) {
  std::string problem = problemOf(sessionInfo, sessionInfoKeys(), "session information");
  if (const Value* token = sessionInfo.find(kKYTReportingSessionInfoHierarchyToken);
      problem.empty() && token != nullptr)
    problem = problemOf(*token->dictionary(), hierarchyTokenKeys(), kKYTReportingSessionInfoHierarchyToken);
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
