// A counting semaphore for the operations that block by design until a reply arrives. wait() announces itself
// to the worker pool (BlockingScope). signal() may be called from any thread; it never blocks. A semaphore
// may be destroyed as soon as its last wait has returned, even while signal() is on its way out on another
// thread.
#pragma once

#include "platform/base/Clock.h"
#include "platform/base/ConditionVariable.h"
#include "platform/base/Mutex.h"

namespace kyt {

class Semaphore {
 public:
  explicit Semaphore(unsigned value = 0) : value_(value) {}
  void wait();
  // Whether it was signalled within `timeout` of real time.
  [[nodiscard]] bool waitFor(Duration timeout);
  void signal();

 private:
  [[nodiscard]] bool tryTake();
  Mutex mutex_;
  ConditionVariable changed_;
  unsigned value_ GUARDED_BY(mutex_);
};

}  // namespace kyt
