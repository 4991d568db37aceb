// How many events were delivered and dropped in the last hour, by reason: a ring of minutes of a fixed size, written where
// fates are booked and read by administrators. An idle daemon does nothing for it: a minute's place is cleared by the first
// who writes in it.
//
// Any thread. A fate costs one look at the clock's figure, which the caller has, and one relaxed addition; one caller a
// minute takes the mutex.
#pragma once

#include <array>
#include <atomic>
#include <cstddef>
#include <cstdint>

#include "platform/base/Clock.h"
#include "platform/base/Counters.h"
#include "platform/base/Mutex.h"

namespace kyt {

struct FateFigures {
  uint64_t delivered = 0;
  std::array<uint64_t, kFates.size()> dropped{};
  [[nodiscard]] uint64_t droppedInAll() const;
};

class RecentFates {
 public:
  void addDelivered(MonotonicTime now, size_t events) { add(now, kFates.size(), events); }
  // `fate`: its place in kFates.
  void addDropped(MonotonicTime now, size_t fate, size_t events) { add(now, fate, events); }
  // Of the minute that runs and the 59 before it.
  [[nodiscard]] FateFigures lastHour(MonotonicTime now) const;

 private:
  static constexpr int64_t kMinutes = 60;
  struct Minute {
    std::atomic<int64_t> number{-1};  // since the clock's beginning
    std::array<std::atomic<uint32_t>, kFates.size() + 1> events{};
  };
  void add(MonotonicTime now, size_t place, size_t events);

  std::array<Minute, kMinutes> minutes_;
  Mutex mutex_;  // for whoever clears a minute
};

}  // namespace kyt
