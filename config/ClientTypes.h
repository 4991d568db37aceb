// What a client type stands for: the storebag that governs its sessions, and the short code that labels its
// data. Pure tables; any thread. Used by the agent (cache key, health report), the storebag fetch and every
// back end that labels records.
#pragma once

#include <cstdint>
#include <optional>

#include "platform/objects/Value.h"

namespace kyt {

inline constexpr int32_t kNumberOfClientTypes = 24;
// The health report tells these types apart; it puts all others under "Unknown".
inline constexpr int32_t kFirstReportedClientType = 5;
inline constexpr int32_t kLastReportedClientType = 23;

// The name of the storebag, which several types may share; none for types 0 to 4 and for what is no client
// type.
[[nodiscard]] std::optional<String> storebagNameForClientType(int32_t type);

// "QA" for 0 … "QV" for 23; "Unknown" for a number that is no client type, since back ends pass on what a
// client sent.
[[nodiscard]] const char* clientTypeShortCode(int32_t type);

}  // namespace kyt
