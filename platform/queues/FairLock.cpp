#include "platform/queues/FairLock.h"

#include <chrono>
#include <utility>

#include "platform/base/Blocking.h"
#include "platform/base/SpinPause.h"
#include "platform/queues/SerialQueue.h"

namespace kyt {

namespace {

constexpr Duration kSlice = std::chrono::milliseconds(1);  // some hundred thread switches

}  // namespace

bool FairLock::takeFree() {
  const unsigned free = free_.load(std::memory_order_relaxed);
  if (free == 0) return false;
  free_.store(free - 1, std::memory_order_relaxed);
  return true;
}

bool FairLock::tryTake() {
  if (free_.load(std::memory_order_relaxed) == 0) return false;
  MutexLock lock(mutex_);
  return takeFree();
}

void FairLock::take() {
  for (int spin = 0; spin < 40; ++spin) {  // most holders are done within a microsecond
    if (tryTake()) return;
    spinPause();
  }
  const BlockingScope blocking(BlockingKind::inLine);
  MutexLock lock(mutex_);
  if (takeFree()) return;
  Waiter self{.owner = SerialQueue::ownerOfThread()};
  enqueue(self);
  while (!self.granted) {
    self.changed.wait(mutex_);
    if (self.granted) return;
    self.woken = false;
    if (firstLine_ != &self || !takeFree()) continue;
    popFirst();
    if (firstLine_ != nullptr && free_.load(std::memory_order_relaxed) != 0) wakeFirst();
    return;
  }
}

// Who waits is told under the mutex: he may be gone as soon as it is free.
void FairLock::giveBack() {
  MutexLock lock(mutex_);
  if (firstLine_ == nullptr) {
    free_.store(free_.load(std::memory_order_relaxed) + 1, std::memory_order_relaxed);
    return;
  }
  const MonotonicTime now = std::chrono::steady_clock::now();
  if (now - passed_ >= kSlice) {
    passed_ = now;
    Waiter* next = popFirst();
    next->granted = true;
    next->changed.notifyOne();
    // That one may have been woken for another place that is free.
    if (firstLine_ != nullptr && free_.load(std::memory_order_relaxed) != 0) wakeFirst();
    return;
  }
  free_.store(free_.load(std::memory_order_relaxed) + 1, std::memory_order_relaxed);
  wakeFirst();
}

void FairLock::wakeFirst() {
  if (!std::exchange(firstLine_->woken, true)) firstLine_->changed.notifyOne();
}

void FairLock::enqueue(Waiter& waiter) {
  for (Waiter* first = firstLine_; first != nullptr; first = first->nextOwner) {
    if (first->owner != waiter.owner) continue;
    first->last->behind = &waiter;
    first->last = &waiter;
    return;
  }
  waiter.last = &waiter;
  appendLine(waiter);
}

void FairLock::appendLine(Waiter& first) {
  (firstLine_ == nullptr ? firstLine_ : lastLine_->nextOwner) = &first;
  lastLine_ = &first;
}

FairLock::Waiter* FairLock::popFirst() {
  Waiter* first = firstLine_;
  firstLine_ = first->nextOwner;
  if (Waiter* next = first->behind) {
    next->last = first->last;
    next->nextOwner = nullptr;
    appendLine(*next);
  }
  return first;
}

}  // namespace kyt
