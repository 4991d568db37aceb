// Who runs queues. The real one is the elastic worker pool; tests use ManualExecutor (platform/fake/).
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
};

}  // namespace kyt
