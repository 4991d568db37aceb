// Rings of devices, for changes that go to some of them first: each device is in one of a hundred, which its identifier
// alone decides, so that it stays there and needs to ask nobody. Which rings have which storebags is the server's affair:
// a ring has an address of its own. Pure; any thread.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace kyt {
class Cryptography;
}

namespace kyt::tools {

inline constexpr uint32_t kRings = 100;

// 0 to 99: the first 64 bits of the SHA-256 of "kytreporting-ring:" and the identifier, big end first, modulo 100. The
// same for good: other programs may compute it.
[[nodiscard]] uint32_t ringOf(std::string_view identifier, Cryptography& cryptography);

// Two digits: "07".
[[nodiscard]] std::string ringText(uint32_t ring);

// The address with the ring's two digits in the place of each "{ring}"; none: there is no such place.
[[nodiscard]] std::optional<std::string> addressOfRing(std::string_view address, uint32_t ring);

}  // namespace kyt::tools
