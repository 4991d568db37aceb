// Which texts the wire protocol admits: UTF-8, object paths, names and signatures. Pure functions, any
// thread; used by the readers on what a peer sent and by the writers on what they are about to send.
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <string>
#include <string_view>

namespace kyt::wire {

// Whether the bytes of `word` are all ASCII and none is NUL: else a high bit is set.
[[nodiscard]] inline uint64_t notPlain(uint64_t word) noexcept {
  return (word | (word - 0x0101010101010101U)) & 0x8080808080808080U;
}
// Whether text is ASCII without NUL, read with few loads and none past its end.
[[nodiscard]] inline bool isPlainText(std::string_view text) noexcept {
  const char* const at = text.data();
  const size_t size = text.size();
  const auto load8 = [](const char* from) {
    uint64_t word;
    std::memcpy(&word, from, sizeof word);
    return word;
  };
  const auto load4 = [](const char* from) {
    uint32_t word;
    std::memcpy(&word, from, sizeof word);
    return uint64_t{word};
  };
  if (size >= 8) {
    uint64_t found = notPlain(load8(at + size - 8));
    for (size_t i = 0; i + 8 < size; i += 8) found |= notPlain(load8(at + i));
    return found == 0;
  }
  if (size >= 4) return notPlain(load4(at) | load4(at + size - 4) << 32) == 0;
  if (size == 0) return true;
  const auto byte = [at](size_t i) { return uint64_t{static_cast<unsigned char>(at[i])}; };
  return notPlain(0x0101010101000000U | byte(0) | byte(size / 2) << 8 | byte(size - 1) << 16) == 0;
}
// Whether text is well formed where it is no plain ASCII.
[[nodiscard]] bool isValidUnicode(std::string_view text) noexcept;
// UTF-8 without NUL, surrogates, overlong forms or code points above U+10FFFF. ASCII is the fast path.
[[nodiscard]] inline bool isValidText(std::string_view text) noexcept {
  return isPlainText(text) || isValidUnicode(text);
}
// Appends `text`; each malformed byte and each NUL becomes U+FFFD, so that the result is always valid.
void appendValidText(std::string_view text, std::string& out);

[[nodiscard]] bool isValidObjectPath(std::string_view path) noexcept;
[[nodiscard]] bool isValidInterfaceName(std::string_view name) noexcept;  // error names follow the same rule
[[nodiscard]] bool isValidMemberName(std::string_view name) noexcept;
[[nodiscard]] bool isValidBusName(std::string_view name) noexcept;

// Zero or more complete types, at most 255 bytes, 32 arrays and 32 structs deep.
[[nodiscard]] bool isValidSignature(std::string_view signature) noexcept;
// Exactly one complete type, as a variant's.
[[nodiscard]] bool isValidSingleSignature(std::string_view signature) noexcept;
// The length of the first complete type of a valid, non-empty signature.
[[nodiscard]] size_t firstTypeLength(std::string_view signature) noexcept;
// 1, 2, 4 or 8 by the type's code.
[[nodiscard]] size_t alignmentOf(char type) noexcept;

}  // namespace kyt::wire
