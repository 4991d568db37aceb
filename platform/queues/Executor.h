// Who runs queues. The real one is the elastic worker pool; tests use ManualExecutor (platform/fake/). It
// outlives its queues and every thread that submits.
#pragma once

#include <cstdint>
#include <memory>

namespace kyt {

class SerialQueue;

class Executor {
 public:
  virtual ~Executor() = default;
  // Runs queue->runPending() once, soon, on a thread of its own. Called from any thread; never blocks; never
  // runs it before returning. Holds the queue until it has run. After its shut-down it calls
  // queue->discardPending() instead.
  virtual void submit(std::shared_ptr<SerialQueue> queue) = 0;
  // Whether a thread of somebody else may run a queue of this executor now, in place of submit(). If so it
  // calls giveBack() afterwards; a shut-down waits for that.
  [[nodiscard]] virtual bool borrow() { return false; }
  // Whether so much is ready that what is submitted now begins only after others have: who could do it himself should.
  // Any thread; never blocks. Out of date at once.
  [[nodiscard]] virtual bool hasMuchReady() { return false; }
  virtual void giveBack() {}
};

}  // namespace kyt
