// The recursive lock of an object (the agent): a thread that holds it may call operations that take it again. Users take
// turns at it (FairLock.h), since a storebag download may hold it for seconds while many wait; the worker pool is told of
// each wait and keeps other sessions running meanwhile. Any thread; no system call without contention. docs/THREADS.md
// has the order of locks.
#pragma once

#include <atomic>

#include "platform/base/Mutex.h"
#include "platform/queues/FairLock.h"

namespace kyt {

class CAPABILITY("monitor") Monitor {
 public:
  Monitor() = default;
  Monitor(const Monitor&) = delete;
  Monitor& operator=(const Monitor&) = delete;
  void lock() ACQUIRE();
  void unlock() RELEASE();
  [[nodiscard]] bool tryLock() TRY_ACQUIRE(true);

 private:
  FairLock lock_;
  std::atomic<const void*> holder_{nullptr};  // identifies the thread
  unsigned depth_ = 0;                        // the holder's: how often it took the monitor again
};

class SCOPED_CAPABILITY MonitorLock {
 public:
  explicit MonitorLock(Monitor& monitor) ACQUIRE(monitor) : monitor_(monitor) { monitor_.lock(); }
  ~MonitorLock() RELEASE() { monitor_.unlock(); }
  MonitorLock(const MonitorLock&) = delete;
  MonitorLock& operator=(const MonitorLock&) = delete;

 private:
  Monitor& monitor_;
};

}  // namespace kyt
