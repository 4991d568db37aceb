// Random numbers and identifiers. Any thread; never blocks.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>

namespace kyt {

class RandomSource {
 public:
  virtual ~RandomSource() = default;
  // Uniform over 0 … bound-1. Precondition: bound > 0.
  [[nodiscard]] virtual uint32_t uniform(uint32_t bound) = 0;
  [[nodiscard]] virtual std::array<std::byte, 16> uuidBytes() = 0;  // a random (version 4) UUID
};

}  // namespace kyt
