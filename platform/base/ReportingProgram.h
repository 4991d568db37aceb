// Whose events they are: what the books, the watchers and the owner's figures tell programs by.
#pragma once

#include <compare>
#include <cstdint>
#include <string>
#include <string_view>

#include "platform/base/Limits.h"

namespace kyt {

// What the kernel says of the client's user, and what the client says of itself. A session that has not yet said its names
// is a program with empty ones.
struct ReportingProgram {
  uint32_t user = 0;
  int32_t clientType = 0;
  std::string clientName, service;
  friend auto operator<=>(const ReportingProgram&, const ReportingProgram&) = default;
};

// The longest beginning of whole UTF-8 characters that has so many bytes at most.
[[nodiscard]] inline std::string_view cutUTF8(std::string_view text, size_t most) {
  if (text.size() <= most) return text;
  while (most > 0 && (static_cast<unsigned char>(text[most]) & 0xC0) == 0x80) --most;
  return text.substr(0, most);
}
// As names stand in the books: clients choose them.
[[nodiscard]] inline std::string_view cutName(std::string_view name) {
  return cutUTF8(name, Limits::maxBookNameBytes);
}

}  // namespace kyt
