// A clock that tests move by hand. Both readings begin at a fixed moment and stand still until told
// otherwise, or pass with each look at the time of day. Any thread.
#pragma once

#include "platform/base/Clock.h"
#include "platform/base/Mutex.h"

namespace kyt {

class ManualClock final : public Clock {
 public:
  [[nodiscard]] TimeValue timeOfDay() const override;
  [[nodiscard]] MonotonicTime monotonic() const override;
  [[nodiscard]] Duration sinceBoot() const override;

  void setTimeOfDay(TimeValue value);  // the monotonic reading stays
  void setMonotonic(MonotonicTime value);
  void advance(Duration duration);  // both readings
  void sleep(Duration duration);    // the monotonic reading stays, that since the boot does not
  // From now on each reading of the time of day is followed by such an advance, so that who reads it twice
  // shows. Zero: stands still again.
  void setTick(Duration tick);

 private:
  void advanceLocked(Duration duration) const REQUIRES(mutex_);

  mutable Mutex mutex_;
  mutable TimeValue timeOfDay_ GUARDED_BY(mutex_){1769860800, 0};  // 2026-01-31 12:00:00
  mutable MonotonicTime monotonic_ GUARDED_BY(mutex_){std::chrono::seconds(1000)};
  Duration tick_ GUARDED_BY(mutex_){0};
  Duration slept_ GUARDED_BY(mutex_){0};
};

}  // namespace kyt
