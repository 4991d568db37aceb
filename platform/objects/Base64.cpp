#include "platform/objects/Base64.h"

#include <algorithm>
#include <array>
#include <cstdint>

namespace kyt {
namespace {

constexpr char kBase64Alphabet[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";

constexpr auto kBase64Values = [] {
  std::array<int8_t, 256> values{};
  values.fill(-1);
  for (int8_t i = 0; i < 64; ++i) values[static_cast<unsigned char>(kBase64Alphabet[i])] = i;
  return values;
}();

}  // namespace

std::string base64(std::span<const std::byte> bytes) {
  std::string text;
  text.reserve((bytes.size() + 2) / 3 * 4);
  for (size_t i = 0; i < bytes.size(); i += 3) {
    const size_t count = std::min<size_t>(3, bytes.size() - i);
    uint32_t group = 0;
    for (size_t k = 0; k < 3; ++k)
      group = group << 8 | (k < count ? std::to_integer<uint32_t>(bytes[i + k]) : 0);
    for (size_t k = 0; k < 4; ++k) text += k <= count ? kBase64Alphabet[group >> (18 - 6 * k) & 63] : '=';
  }
  return text;
}

std::optional<Data> base64Decode(std::string_view text) {
  std::string bytes;
  bytes.reserve(text.size() / 4 * 3 + 3);
  uint32_t group = 0;
  size_t letters = 0;
  size_t padding = 0;
  for (const char c : text) {
    if (c == '=') {
      ++padding;
      continue;
    }
    const int8_t value = kBase64Values[static_cast<unsigned char>(c)];
    if (value < 0) continue;
    if (padding != 0) return std::nullopt;  // text goes on after its end
    group = group << 6 | static_cast<uint32_t>(value);
    if (++letters % 4 != 0) continue;
    for (const int shift : {16, 8, 0}) bytes += static_cast<char>(group >> shift & 0xFF);
  }
  const size_t rest = letters % 4;
  if (rest == 1 || padding != (4 - rest) % 4) return std::nullopt;
  group <<= 6 * padding;
  if (rest >= 2) bytes += static_cast<char>(group >> 16 & 0xFF);
  if (rest == 3) bytes += static_cast<char>(group >> 8 & 0xFF);
  return Data(std::string_view(bytes));
}

}  // namespace kyt
