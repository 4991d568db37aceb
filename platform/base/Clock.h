// The time of day and the monotonic clock. Everything that stamps, ages or waits takes time from here, so that tests
// move it by hand (platform/fake/ManualClock.h). Callable from any thread, never blocks, never fails.
#pragma once

#include <chrono>
#include <cstdint>

namespace kyt {

// A time of day: whole seconds since 1970 and microseconds (0 to 999999).
struct TimeValue {
  int64_t seconds = 0;
  int32_t microseconds = 0;
  [[nodiscard]] double asSeconds() const { return static_cast<double>(seconds) + microseconds / 1000000.0; }
  friend bool operator==(const TimeValue&, const TimeValue&) = default;
};

using Duration = std::chrono::nanoseconds;
using MonotonicTime = std::chrono::time_point<std::chrono::steady_clock, Duration>;

class Clock {
 public:
  virtual ~Clock() = default;
  [[nodiscard]] virtual TimeValue timeOfDay() const = 0;
  [[nodiscard]] virtual MonotonicTime monotonic() const = 0;
  // Goes on while the machine sleeps, which monotonic() does not.
  [[nodiscard]] virtual Duration sinceBoot() const { return monotonic().time_since_epoch(); }
};

}  // namespace kyt
