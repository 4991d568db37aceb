// Bytes as hexadecimal digits, and the digits back. Any thread.
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <string>
#include <string_view>

namespace kyt {

// Two digits, in lower case.
inline void appendHexByte(uint8_t byte, std::string& out) {
  constexpr char kDigits[] = "0123456789abcdef";
  out += kDigits[byte >> 4];
  out += kDigits[byte & 15];
}

inline void appendHex(std::span<const std::byte> bytes, std::string& out) {
  for (const std::byte byte : bytes) appendHexByte(std::to_integer<uint8_t>(byte), out);
}

inline void appendHex(std::string_view bytes, std::string& out) {
  appendHex(std::as_bytes(std::span(bytes)), out);
}

// 0 to 15, of a digit in either case; -1 of anything else.
[[nodiscard]] constexpr int hexDigit(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

}  // namespace kyt
