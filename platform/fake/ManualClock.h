// A clock that tests move by hand. Both readings begin at a fixed moment and stand still until told
// otherwise. Any thread.
#pragma once

#include "platform/Clock.h"
#include "platform/Mutex.h"

namespace kyt {

class ManualClock final : public Clock {
 public:
  [[nodiscard]] TimeValue timeOfDay() const override;
  [[nodiscard]] MonotonicTime monotonic() const override;

  void setTimeOfDay(TimeValue value);  // the monotonic reading stays
  void setMonotonic(MonotonicTime value);
  void advance(Duration duration);  // both readings

 private:
  mutable Mutex mutex_;
  TimeValue timeOfDay_ GUARDED_BY(mutex_){1769860800, 0};  // 2026-01-31 12:00:00
  MonotonicTime monotonic_ GUARDED_BY(mutex_){std::chrono::seconds(1000)};
};

}  // namespace kyt
