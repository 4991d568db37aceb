// The elastic worker pool: the threads that run serial queues.
//
// Several operations block by design (a storebag download, uploads, the wait for the agent's monitor while it
// is held by a download). A worker announces that with a BlockingScope, and the pool then keeps enough others
// running. At most `Limits::maxWorkers` threads exist. The queues of one owner occupy at most half of those that others
// do not, and those that stand in line for a lock at most a quarter as many as are left, so that several owners together
// leave some to the next; work past that waits, counted. Idle workers end after a while, the last one too, so an idle daemon has no
// wake-ups.
//
// The queues of one owner run in the order of their submission, and the owners take turns: whoever has made many queues
// ready holds up his own (OwnerLines.h). A submission wakes a worker only when fewer than `runnable`
// run and none of them is just about to look for work; a worker that takes one queue and leaves others wakes
// the next. A worker that the system refuses to start is tried again with the next submission.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>

#include "platform/base/Clock.h"
#include "platform/queues/Executor.h"

namespace kyt {

class Counters;
class Log;

struct WorkerPoolOptions {
  size_t runnable = 0;  // workers that may run without being blocked; 0: the number of processors, at least 2
  size_t maxWorkers = 512;    // threads in all
  size_t mostOfOneOwner = 0;  // of these; 0: half of them
  Duration idleExit = std::chrono::seconds(10);
  const char* name = "kyt-worker";                 // at most 11 bytes; a number follows
  void (*nameThread)(const char* name) = nullptr;  // how the operating system is told a thread's name
  // Called by a worker that ends for want of work when at most one is left, and any has worked since the last call. No
  // lock is held.
  void (*whenQuiet)() = nullptr;
  Counters* counters = nullptr;  // Reason::workersExhausted, each time a queue must wait for a limit
  Log* log = nullptr;            // with `counters`: a line about that, at most once a minute
};

struct WorkerPoolFigures {
  size_t workers = 0, idle = 0, blocked = 0, waitingQueues = 0, mostWorkers = 0;
  uint64_t wakeUps = 0;  // workers started or woken
};

class WorkerPool final : public Executor {
 public:
  explicit WorkerPool(WorkerPoolOptions options);
  ~WorkerPool() override;  // shutDown()
  void submit(std::shared_ptr<SerialQueue> queue) override;
  [[nodiscard]] bool borrow() override;
  // As many queues as may run at once.
  [[nodiscard]] bool hasMuchReady() override;
  void giveBack() override;
  // From now on whoever submits does not wait for a thread that the system refuses: what is ready waits until
  // tryAgain(), which the caller then owes, or the next submission finds one.
  void stopInsisting();
  void tryAgain();
  // Takes no more work, waits for the workers to finish what runs, destroys what is pending. Not from a
  // worker.
  void shutDown();
  // The same, but waits so long at most: false when some are still at it. Then neither pool nor what they use may end.
  [[nodiscard]] bool shutDownWithin(Duration patience);
  [[nodiscard]] WorkerPoolFigures figures() const;

 private:
  struct Worker;
  class Implementation;
  std::unique_ptr<Implementation> implementation_;
};

}  // namespace kyt
