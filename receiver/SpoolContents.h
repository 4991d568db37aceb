// The posts of a spool that no receiver has, for people: what the log never takes stays there until somebody removes it.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <variant>
#include <vector>

#include "receiver/Settings.h"

namespace kyt::receiver {

struct SpooledPost {
  int64_t number = 0;
  std::string id;      // empty: the disk does not give it
  int64_t keptAt = 0;  // seconds since 1970
  uint64_t bytes = 0;  // with its headers
  std::string sender;  // SENDER/CLIENT as the post names them, printable; may be empty
};

// Oldest first; or what is wrong. Nothing is changed.
[[nodiscard]] std::variant<std::vector<SpooledPost>, std::string> postsOfSpool(const Settings& settings);
// For good: what is wrong, or none.
[[nodiscard]] std::optional<std::string> removeFromSpool(const Settings& settings, int64_t number);

}  // namespace kyt::receiver
