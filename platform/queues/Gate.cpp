#include "platform/queues/Gate.h"

#include "platform/queues/WorkerPool.h"

namespace kyt {

bool Gate::tryEnter() {
  MutexLock lock(mutex_);
  if (taken_) return false;
  taken_ = true;
  return true;
}

// What it is a lock for is told to the analysis in the header; the flag behind it is no lock that the analysis knows.
void Gate::enter() NO_THREAD_SAFETY_ANALYSIS {
  if (tryEnter()) return;
  const BlockingScope blocking;
  MutexLock lock(mutex_);
  while (taken_) left_.wait(mutex_);
  taken_ = true;
}

void Gate::leave() NO_THREAD_SAFETY_ANALYSIS {
  MutexLock lock(mutex_);
  taken_ = false;
  left_.notifyOne();
}

}  // namespace kyt
