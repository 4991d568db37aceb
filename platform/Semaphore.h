// A counting semaphore for the operations that block by design until a reply arrives. wait() announces itself to the
// worker pool (BlockingScope). signal() may be called from any thread; it never blocks.
#pragma once

#include <condition_variable>

#include "platform/Clock.h"
#include "platform/Mutex.h"

namespace kyt {

class Semaphore {
 public:
  explicit Semaphore(unsigned value = 0) : value_(value) {}
  void wait();
  // Whether it was signalled within `timeout` of real time.
  [[nodiscard]] bool waitFor(Duration timeout);
  void signal();

 private:
  Mutex mutex_;
  std::condition_variable changed_;
  unsigned value_ GUARDED_BY(mutex_);
};

}  // namespace kyt
