// Identifiers that stay the same on this device, in the daemon's user defaults. Any thread; the first use of a key may
// wait for the disk.
#pragma once

#include <cstdint>
#include <optional>
#include <string_view>

#include "platform/objects/Value.h"

namespace kyt {

struct Platform;

// What is stored under the key; otherwise `made`, or without it a new random UUID, which is then stored. `owner` is the
// user for whose client it is made; none: the daemon's own.
[[nodiscard]] String persistentIdentifier(Platform& platform, std::optional<uint32_t> owner,
                                          std::string_view key, const String* made = nullptr);

}  // namespace kyt
