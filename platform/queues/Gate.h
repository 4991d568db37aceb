// A lock for what only one thread may do at a time and what takes long: it waits for another process, or for the disk.
// Unlike those of a Mutex its waiters announce themselves to the worker pool, nothing is locked while they wait, and users
// take turns (FairLock.h).
#pragma once

#include "platform/base/Mutex.h"
#include "platform/queues/FairLock.h"

namespace kyt {

class CAPABILITY("gate") Gate {
 public:
  Gate() = default;
  Gate(const Gate&) = delete;
  Gate& operator=(const Gate&) = delete;
  // What it is a lock for is told to the analysis here; what is behind it is no lock that the analysis knows.
  void enter() ACQUIRE() NO_THREAD_SAFETY_ANALYSIS { lock_.take(); }
  void leave() RELEASE() NO_THREAD_SAFETY_ANALYSIS { lock_.giveBack(); }

 private:
  FairLock lock_;
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
