// Waiting for a condition that another thread brings about; false when half a minute was not enough.
#pragma once

#include <chrono>
#include <thread>

namespace kyt {

inline constexpr std::chrono::seconds kTestDeadline{30};

template <typename Condition>
[[nodiscard]] bool eventually(Condition condition) {
  const auto end = std::chrono::steady_clock::now() + kTestDeadline;
  while (!condition()) {
    if (std::chrono::steady_clock::now() > end) return false;
    std::this_thread::sleep_for(std::chrono::microseconds(200));
  }
  return true;
}

}  // namespace kyt
