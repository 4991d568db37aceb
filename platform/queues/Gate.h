// A lock for what only one thread may do at a time and what takes long: it waits for another process, or for the disk.
// Unlike those of a Mutex its waiters announce themselves to the worker pool, and nothing is locked while they wait.
#pragma once

#include "platform/base/ConditionVariable.h"
#include "platform/base/Mutex.h"

namespace kyt {

class CAPABILITY("gate") Gate {
 public:
  Gate() = default;
  Gate(const Gate&) = delete;
  Gate& operator=(const Gate&) = delete;
  void enter() ACQUIRE();
  void leave() RELEASE();

 private:
  [[nodiscard]] bool tryEnter();
  Mutex mutex_;
  ConditionVariable left_;
  bool taken_ GUARDED_BY(mutex_) = false;
};

class SCOPED_CAPABILITY GateLock {
 public:
  explicit GateLock(Gate& gate) ACQUIRE(gate) : gate_(gate) { gate_.enter(); }
  ~GateLock() RELEASE() { gate_.leave(); }
  GateLock(const GateLock&) = delete;
  GateLock& operator=(const GateLock&) = delete;

 private:
  Gate& gate_;
};

}  // namespace kyt
