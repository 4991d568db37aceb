// What a JSON object of a script may hold. The daemon reads leniently, so a misspelt key would count as missing and a
// value of another type as 0 or no: a person who types a script is told instead.
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "platform/Value.h"

namespace kyt::tools {

enum class KeyKind : uint8_t { boolean, number, text, object };

struct KeyRule {
  std::string_view name;
  KeyKind kind;
  bool required = false;
  int64_t least = 0, most = 0;  // of a number
};

// What is wrong with the first entry that is none of these, or with the first that is missing; none when all is well.
[[nodiscard]] std::optional<std::string> problemIn(const Dictionary& object, std::span<const KeyRule> rules);

// The same for the information that a session opens with, its hierarchy token included.
[[nodiscard]] std::optional<std::string> problemInSessionInfo(const Dictionary& sessionInfo);

}  // namespace kyt::tools
