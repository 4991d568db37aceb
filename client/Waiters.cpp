#include "client/Waiters.h"

namespace kyt::client {

void Waiters::goodbyeAnswered(bool success) {
  MutexLock lock(mutex_);
  finished_ = finished_ || success;
  goodbyeOver_ = true;
  changed_.notifyAll();
}

void Waiters::sessionEnded() {
  MutexLock lock(mutex_);
  goodbyeOver_ = true;
  ended_ = true;
  changed_.notifyAll();
}

bool Waiters::waitForGoodbye(std::chrono::milliseconds timeout) {
  const MonotonicTime deadline = std::chrono::steady_clock::now() + timeout;
  MutexLock lock(mutex_);
  bool inTime = true;
  while (!goodbyeOver_ && inTime) inTime = changed_.waitUntil(mutex_, deadline);
  return finished_;
}

void Waiters::waitForEnd() {
  MutexLock lock(mutex_);
  while (!ended_) changed_.wait(mutex_);
}

}  // namespace kyt::client
