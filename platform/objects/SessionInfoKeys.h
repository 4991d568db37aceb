// The keys of a session's information and of its hierarchy token, and what their values are: one table for the client
// library, which refuses what cannot be meant so, and for the daemon, which reads on and counts it.
#pragma once

#include <cstdint>
#include <span>
#include <string_view>

namespace kyt {

struct SessionInfoKey {
  enum class Kind : uint8_t { boolean, number, text, dictionary };
  const char* key;
  Kind kind;
  uint64_t most = 0;  // of a number, which is whole and begins at 0

  // Null for a key that there is not.
  [[nodiscard]] static const SessionInfoKey* find(std::span<const SessionInfoKey> keys, std::string_view key);
};

[[nodiscard]] std::span<const SessionInfoKey> sessionInfoKeys();
[[nodiscard]] std::span<const SessionInfoKey> hierarchyTokenKeys();

}  // namespace kyt
