// What the commands that ask at the administration socket have in common: how they print JSON, and how they read a user.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/objects/Value.h"

namespace kyt::tools {

// One line.
void printJSON(const Value& value);
[[nodiscard]] Value listed(const char* key, std::vector<Dictionary> rows);
// A program's names, "client" and "service", as "client:service": no two pairs of names alike, and escaped already.
[[nodiscard]] std::string programText(const Dictionary& program);
// By name or number; none: there is no such user.
[[nodiscard]] std::optional<uint32_t> userOf(const std::string& text);

}  // namespace kyt::tools
