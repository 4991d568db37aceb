#include "platform/base/RecentFates.h"

#include <chrono>
#include <numeric>

namespace kyt {

namespace {

int64_t minuteOf(MonotonicTime now) {
  return std::chrono::duration_cast<std::chrono::minutes>(now.time_since_epoch()).count();
}

}  // namespace

uint64_t FateFigures::droppedInAll() const {
  return std::accumulate(dropped.begin(), dropped.end(), uint64_t{0});
}

// A writer that stood still for an hour between its look at the minute and its addition adds to a later minute.
void RecentFates::add(MonotonicTime now, size_t place, size_t events) {
  const int64_t number = minuteOf(now);
  Minute& minute = minutes_[static_cast<size_t>(number % kMinutes)];
  if (minute.number.load(std::memory_order_acquire) != number) {
    MutexLock lock(mutex_);
    if (minute.number.load(std::memory_order_relaxed) < number) {
      for (auto& count : minute.events) count.store(0, std::memory_order_relaxed);
      minute.number.store(number, std::memory_order_release);
    }
  }
  minute.events[place].fetch_add(static_cast<uint32_t>(events), std::memory_order_relaxed);
}

FateFigures RecentFates::lastHour(MonotonicTime now) const {
  const int64_t last = minuteOf(now);
  FateFigures figures;
  for (const Minute& minute : minutes_) {
    const int64_t number = minute.number.load(std::memory_order_acquire);
    if (number < 0 || number > last || number <= last - kMinutes) continue;
    for (size_t i = 0; i < kFates.size(); ++i)
      figures.dropped[i] += minute.events[i].load(std::memory_order_relaxed);
    figures.delivered += minute.events[kFates.size()].load(std::memory_order_relaxed);
  }
  return figures;
}

}  // namespace kyt
