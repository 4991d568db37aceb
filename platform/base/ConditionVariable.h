// Waiting on a Mutex in a way that the thread-safety analysis follows. Waits may end spuriously: callers loop
// over their condition. Whoever waits for long announces that first (BlockingScope).
#pragma once

#include <condition_variable>
#include <mutex>

#include "platform/base/Clock.h"
#include "platform/base/Mutex.h"

namespace kyt {

class ConditionVariable {
 public:
  void wait(Mutex& mutex) REQUIRES(mutex) {
    std::unique_lock lock(mutex.native(), std::adopt_lock);
    changed_.wait(lock);
    lock.release();
  }
  // False when the time is over.
  bool waitUntil(Mutex& mutex, MonotonicTime deadline) REQUIRES(mutex) {
    std::unique_lock lock(mutex.native(), std::adopt_lock);
    const bool inTime = changed_.wait_until(lock, deadline) == std::cv_status::no_timeout;
    lock.release();
    return inTime;
  }
  void notifyOne() { changed_.notify_one(); }
  void notifyAll() { changed_.notify_all(); }

 private:
  std::condition_variable changed_;
};

}  // namespace kyt
