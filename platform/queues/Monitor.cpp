#include "platform/queues/Monitor.h"

namespace kyt {

namespace {

thread_local char identity;  // its address tells threads apart

}  // namespace

void Monitor::lock() NO_THREAD_SAFETY_ANALYSIS {
  if (holder_.load(std::memory_order_relaxed) == &identity) {
    ++depth_;
    return;
  }
  lock_.take();
  holder_.store(&identity, std::memory_order_relaxed);
}

bool Monitor::tryLock() NO_THREAD_SAFETY_ANALYSIS {
  if (holder_.load(std::memory_order_relaxed) == &identity) {
    ++depth_;
    return true;
  }
  if (!lock_.tryTake()) return false;
  holder_.store(&identity, std::memory_order_relaxed);
  return true;
}

void Monitor::unlock() NO_THREAD_SAFETY_ANALYSIS {
  if (depth_ > 0) {
    --depth_;
    return;
  }
  holder_.store(nullptr, std::memory_order_relaxed);
  lock_.giveBack();
}

}  // namespace kyt
