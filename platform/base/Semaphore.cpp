#include "platform/base/Semaphore.h"

#include "platform/base/Blocking.h"

namespace kyt {

bool Semaphore::tryTake() {
  MutexLock lock(mutex_);
  if (value_ == 0) return false;
  --value_;
  return true;
}

void Semaphore::wait() {
  if (tryTake()) return;
  BlockingScope blocking;
  MutexLock lock(mutex_);
  while (value_ == 0) changed_.wait(mutex_);
  --value_;
}

bool Semaphore::waitFor(Duration timeout) {
  if (tryTake()) return true;
  BlockingScope blocking;
  const MonotonicTime deadline = std::chrono::steady_clock::now() + timeout;
  MutexLock lock(mutex_);
  while (value_ == 0)
    if (!changed_.waitUntil(mutex_, deadline) && value_ == 0) return false;
  --value_;
  return true;
}

void Semaphore::signal() {
  MutexLock lock(mutex_);
  ++value_;
  // Under the lock: the waiter cannot return, and end the semaphore, before this is done.
  changed_.notifyOne();
}

}  // namespace kyt
