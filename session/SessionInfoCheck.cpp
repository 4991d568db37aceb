#include "session/SessionInfoCheck.h"

#include <span>

#include "platform/Platform.h"
#include "platform/base/Clock.h"
#include "platform/base/Counters.h"
#include "platform/objects/Keys.h"
#include "platform/objects/SessionInfoKeys.h"
#include "platform/objects/Value.h"
#include "platform/queues/Log.h"

namespace kyt {

namespace {

// Ranges are left to whoever reads the number.
bool isOfItsKind(const Value& value, SessionInfoKey::Kind kind) {
  switch (kind) {
    case SessionInfoKey::Kind::boolean:
      return value.isNumber();
    case SessionInfoKey::Kind::number:
      return value.isNumber() && value.kind() != Value::Kind::boolean;
    case SessionInfoKey::Kind::text:
      return value.isString();
    case SessionInfoKey::Kind::dictionary:
      return value.isDictionary();
  }
  return false;
}

void count(const Dictionary& dictionary, std::span<const SessionInfoKey> known, Platform& platform) {
  for (const DictionaryEntry& entry : dictionary) {
    const SessionInfoKey* const found = SessionInfoKey::find(known, entry.key.view());
    if (found != nullptr && isOfItsKind(entry.value, found->kind)) continue;
    const bool isUnknown = found == nullptr;
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
  count(sessionInfo, sessionInfoKeys(), platform);
  const Value* token = sessionInfo.find(kKYTReportingSessionInfoHierarchyToken);
  if (token != nullptr && token->isDictionary()) count(*token->dictionary(), hierarchyTokenKeys(), platform);
}

}  // namespace kyt
