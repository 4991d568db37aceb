// What a JSON object that a person types for kytctl or kytfeed may hold. Read leniently, a misspelt key would count as
// missing and a value of another type as 0 or no: the person is told instead.
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "platform/objects/Value.h"

namespace kyt::tools {

enum class KeyKind : uint8_t { boolean, number, real, text, object };

struct KeyRule {
  std::string_view name;
  KeyKind kind;
  bool required = false;
  int64_t least = 0, most = 0;  // of a number, which is a whole one
};

// What is wrong with the first entry that is none of these, or with the first that is missing; none when all is well.
[[nodiscard]] std::optional<std::string> problemIn(const Dictionary& object, std::span<const KeyRule> rules);

}  // namespace kyt::tools
