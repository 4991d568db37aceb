// IPv4 addresses as text. A pure function; any thread.
#pragma once

#include <cstdint>
#include <string_view>

namespace kyt {

inline constexpr uint32_t kNoIPv4Address = 0xFFFFFFFF;  // also what "255.255.255.255" says

// The address that the text names, its first byte the highest, by the rules of the classic inet_addr(): one
// to four numbers between dots, each decimal, octal after "0" or hexadecimal after "0x"; the last one fills
// all the bytes that are left; what follows a blank is ignored. Never looks a name up. A text that is none of
// this is all ones.
[[nodiscard]] uint32_t ipv4Address(std::string_view text);

}  // namespace kyt
