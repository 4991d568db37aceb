// Randomness of the kernel.
#pragma once

#include "platform/RandomSource.h"

namespace kyt {

class LinuxRandom : public RandomSource {
 public:
  [[nodiscard]] uint32_t uniform(uint32_t bound) override;
  [[nodiscard]] std::array<std::byte, 16> uuidBytes() override;
};

}  // namespace kyt
