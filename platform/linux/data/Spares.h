// What costs much to make and is needed again soon, a few of it kept between its users. Any thread.
#pragma once

#include <cstddef>
#include <utility>
#include <vector>

#include "platform/base/Mutex.h"

namespace kyt {

// Of `Handle`, a unique_ptr of whatever kind.
template <typename Handle>
class Spares {
 public:
  explicit Spares(size_t most) : most_(most) {}

  // Null: none is kept.
  [[nodiscard]] Handle take() EXCLUDES(mutex_) {
    MutexLock lock(mutex_);
    if (kept_.empty()) return nullptr;
    Handle taken = std::move(kept_.back());
    kept_.pop_back();
    return taken;
  }
  // What is past the most goes; null is nothing.
  void giveBack(Handle handle) EXCLUDES(mutex_) {
    if (handle == nullptr) return;
    MutexLock lock(mutex_);
    if (kept_.size() < most_) kept_.push_back(std::move(handle));
  }
  [[nodiscard]] size_t kept() const EXCLUDES(mutex_) {
    MutexLock lock(mutex_);
    return kept_.size();
  }

 private:
  const size_t most_;
  mutable Mutex mutex_;
  std::vector<Handle> kept_ GUARDED_BY(mutex_);
};

}  // namespace kyt
