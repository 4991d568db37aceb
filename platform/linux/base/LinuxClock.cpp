#include "platform/linux/base/LinuxClock.h"

#include <time.h>

namespace kyt {

TimeValue LinuxClock::timeOfDay() const {
  timespec now{};
  clock_gettime(CLOCK_REALTIME, &now);
  return {now.tv_sec, static_cast<int32_t>(now.tv_nsec / 1000)};
}

MonotonicTime LinuxClock::monotonic() const {
  timespec now{};
  clock_gettime(CLOCK_MONOTONIC, &now);
  return MonotonicTime(std::chrono::seconds(now.tv_sec) + std::chrono::nanoseconds(now.tv_nsec));
}

Duration LinuxClock::sinceBoot() const {
  timespec now{};
  clock_gettime(CLOCK_BOOTTIME, &now);
  return std::chrono::seconds(now.tv_sec) + std::chrono::nanoseconds(now.tv_nsec);
}

}  // namespace kyt
