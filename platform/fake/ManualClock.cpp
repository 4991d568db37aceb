#include "platform/fake/ManualClock.h"

namespace kyt {

TimeValue ManualClock::timeOfDay() const {
  MutexLock lock(mutex_);
  const TimeValue reading = timeOfDay_;
  if (tick_ != Duration(0)) advanceLocked(tick_);
  return reading;
}

MonotonicTime ManualClock::monotonic() const {
  MutexLock lock(mutex_);
  return monotonic_;
}

Duration ManualClock::sinceBoot() const {
  MutexLock lock(mutex_);
  return monotonic_.time_since_epoch() + slept_;
}

void ManualClock::sleep(Duration duration) {
  MutexLock lock(mutex_);
  const MonotonicTime before = monotonic_;
  advanceLocked(duration);
  monotonic_ = before;
  slept_ += duration;
}

void ManualClock::setTimeOfDay(TimeValue value) {
  MutexLock lock(mutex_);
  timeOfDay_ = value;
}

void ManualClock::setMonotonic(MonotonicTime value) {
  MutexLock lock(mutex_);
  monotonic_ = value;
}

void ManualClock::setTick(Duration tick) {
  MutexLock lock(mutex_);
  tick_ = tick;
}

void ManualClock::advance(Duration duration) {
  MutexLock lock(mutex_);
  advanceLocked(duration);
}

void ManualClock::advanceLocked(Duration duration) const {
  using namespace std::chrono;
  monotonic_ += duration;
  const microseconds day = seconds(timeOfDay_.seconds) + microseconds(timeOfDay_.microseconds) +
                           duration_cast<microseconds>(duration);
  const seconds whole = floor<seconds>(day);
  timeOfDay_ = {whole.count(), static_cast<int32_t>((day - whole).count())};
}

}  // namespace kyt
