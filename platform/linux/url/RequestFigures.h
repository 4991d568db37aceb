// The figures of all requests. Any thread.
#pragma once

#include "platform/URLSession.h"
#include "platform/base/Mutex.h"

namespace kyt {

class RequestFigures {
 public:
  void add(uint64_t URLFigures::*figure, uint64_t amount = 1) EXCLUDES(mutex_) {
    MutexLock lock(mutex_);
    figures_.*figure += amount;
  }
  void subtract(uint64_t URLFigures::*figure, uint64_t amount = 1) EXCLUDES(mutex_) {
    MutexLock lock(mutex_);
    figures_.*figure -= amount;
  }
  // Of one moment.
  [[nodiscard]] URLFigures now() const EXCLUDES(mutex_) {
    MutexLock lock(mutex_);
    return figures_;
  }

 private:
  mutable Mutex mutex_;
  URLFigures figures_ GUARDED_BY(mutex_);
};

}  // namespace kyt
