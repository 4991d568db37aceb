// Identifiers as text. A pure function; any thread.
#pragma once

#include <array>
#include <cstddef>
#include <string>

namespace kyt {

// "xxxxxxxx-xxxx-…", upper case, as identifiers are written everywhere here.
[[nodiscard]] std::string uuidText(const std::array<std::byte, 16>& bytes);

}  // namespace kyt
