// TOML text as objects, for bags that people write and for scripts.
#pragma once

#include <string_view>
#include <variant>

#include "platform/base/Error.h"
#include "platform/objects/Value.h"

namespace kyt::tools {

// The root table as a dictionary (keys in the order in which they stand), or an error with line and column.
[[nodiscard]] std::variant<Value, Error> parseToml(std::string_view text);

}  // namespace kyt::tools
