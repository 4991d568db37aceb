// What left, in order.
#pragma once

#include <vector>

#include "platform/base/Departures.h"
#include "platform/base/Mutex.h"

namespace kyt {

class FakeDepartures final : public Departures {
 public:
  void add(const Departure& departure) override {
    MutexLock lock(mutex_);
    all_.push_back(departure);
  }
  [[nodiscard]] std::vector<Departure> all() const {
    MutexLock lock(mutex_);
    return all_;
  }

 private:
  mutable Mutex mutex_;
  std::vector<Departure> all_ GUARDED_BY(mutex_);
};

}  // namespace kyt
