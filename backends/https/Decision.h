// What the storebag decided for one session: ClientRules writes it, HTTPSPostBackend acts by it. The session's queue.
#pragma once

#include <cstdint>
#include <optional>

#include "backends/https/EventFilters.h"
#include "platform/objects/Value.h"

namespace kyt {

struct Decision {
  // Kept until a later decision has another.
  std::optional<String> postURL, realtimePostURL;
  // From the user defaults: the storebag does not replace it.
  bool useDefaultPostURL = false, useDefaultRealtimePostURL = false;
  EventFilters filters;
  // 0: the entry respects the consent; 1: overrides it, consent off; 2: overrides it, consent on.
  int32_t dnuType = 0;
  // A record first flushes a batch that already holds more than this many of its method.
  int32_t eventThreshold = 49;
  int32_t extrasOnInternal = 0;
  Value overrideSampling;  // a number, or null
  std::optional<String> uuidCustom;
  bool shouldUseWiFiOnly = false;

  // Of the latest decision alone; missing where its entry says nothing, which leaves what was.
  std::optional<bool> batchEvents;
  std::optional<Value> samplingThreshold;  // a number, or null
  std::optional<Array> eventWhitelist, eventBlacklist;
};

}  // namespace kyt
