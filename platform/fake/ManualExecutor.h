// An executor that a test drains itself: queues that were submitted wait here until runOne() or runAll() runs
// them on the calling thread. submit() may be called from any thread. Everything still waiting at
// destruction, or submitted after shutDown(), is destroyed unrun, as with the worker pool.
#pragma once

#include <atomic>
#include <deque>
#include <memory>

#include "platform/base/Mutex.h"
#include "platform/queues/Executor.h"

namespace kyt {

class ManualExecutor final : public Executor {
 public:
  ManualExecutor() = default;
  ~ManualExecutor() override { shutDown(); }
  void submit(std::shared_ptr<SerialQueue> queue) override;

  bool runOne();    // one queue's turn; false when none waits
  size_t runAll();  // until none waits; how many turns that took
  [[nodiscard]] size_t pending() const;
  [[nodiscard]] bool hasMuchReady() override { return muchReady_; }
  void setMuchReady(bool value) { muchReady_ = value; }
  void shutDown();

 private:
  [[nodiscard]] std::shared_ptr<SerialQueue> takeFirst();
  mutable Mutex mutex_;
  std::deque<std::shared_ptr<SerialQueue>> queues_ GUARDED_BY(mutex_);
  bool shutDown_ GUARDED_BY(mutex_) = false;
  std::atomic<bool> muchReady_{false};
};

}  // namespace kyt
