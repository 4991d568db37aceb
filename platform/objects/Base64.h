// Base64, the alphabet with "+" and "/". Pure functions; any thread.
#pragma once

#include <cstddef>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "platform/objects/Value.h"

namespace kyt {

// With padding and with no line breaks.
[[nodiscard]] std::string base64(std::span<const std::byte> bytes);
// Characters outside the alphabet are ignored; none when what remains is no base64 (length, padding).
[[nodiscard]] std::optional<Data> base64Decode(std::string_view text);

}  // namespace kyt
