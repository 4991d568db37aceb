// A lock that users take turns at, below Monitor and Gate; one for several holders at a time below LargeWork. Threads that wait for it stand in a line of their user's (the
// owner of the queue that they run), and the users take turns: however many threads of one user wait, the first one of
// another user's is at most one place behind each user's. Within a line the order is that of arrival.
//
// Who gives the lock back mostly leaves it to whoever takes it next, a running thread as a rule, since passing it to a
// thread that sleeps costs everybody a thread switch. But once a millisecond it is passed to the first in line, so no
// waiter starves: he gets it after as many milliseconds, or holds that are longer, as users wait.
//
// Any thread. take() announces the wait to the worker pool, as one in line (BlockingScope). Not recursive.
#pragma once

#include <atomic>
#include <cstdint>

#include "platform/base/Clock.h"
#include "platform/base/ConditionVariable.h"
#include "platform/base/Mutex.h"

namespace kyt {

class FairLock {
 public:
  explicit FairLock(unsigned holders = 1) : free_(holders) {}
  FairLock(const FairLock&) = delete;
  FairLock& operator=(const FairLock&) = delete;
  void take();
  [[nodiscard]] bool tryTake();
  void giveBack();

 private:
  // On the stack of who waits.
  struct Waiter {
    uint64_t owner;
    Waiter* nextOwner = nullptr;  // of the first of each line: the first of the next line
    Waiter* behind = nullptr;     // in the same line
    Waiter* last = nullptr;       // of the first of each line
    bool granted = false;
    bool woken = false;
    ConditionVariable changed{};
  };
  void enqueue(Waiter& waiter) REQUIRES(mutex_);
  void appendLine(Waiter& first) REQUIRES(mutex_);
  Waiter* popFirst() REQUIRES(mutex_);
  [[nodiscard]] bool takeFree() REQUIRES(mutex_);
  void wakeFirst() REQUIRES(mutex_);

  Mutex mutex_;
  std::atomic<unsigned> free_;  // that many more may hold it; written under the mutex
  Waiter* firstLine_ GUARDED_BY(mutex_) = nullptr;
  Waiter* lastLine_ GUARDED_BY(mutex_) = nullptr;
  MonotonicTime passed_ GUARDED_BY(mutex_);  // when it was passed to a waiter last
};

}  // namespace kyt
