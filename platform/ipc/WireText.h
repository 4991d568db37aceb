// Which texts the wire protocol admits: UTF-8, object paths, names and signatures. Pure functions, any
// thread; used by the readers on what a peer sent and by the writers on what they are about to send.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>

namespace kyt::wire {

// UTF-8 without NUL, surrogates, overlong forms or code points above U+10FFFF. ASCII is the fast path.
[[nodiscard]] bool isValidText(std::string_view text) noexcept;
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
