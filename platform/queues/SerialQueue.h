// Serial task queues: work runs one piece at a time in the order it was submitted, whatever threads run it.
// Every stateful object of the daemon belongs to one.
//
// - async(): the work runs later. On a thread inside a Turn (a connection's worker that handles its client's calls) an
//   idle queue wakes no other thread: the turn runs the queue at its end at the latest. Elsewhere the executor gives
//   it a worker. asyncBeside() leaves it to the executor in any case.
// - sync(): runs the work on the caller's thread and returns after it. Waits while another thread runs the queue.
//   Runs earlier work that has not begun first. On an idle queue it costs one uncontended atomic exchange each way.
//   A call from a queue onto itself is a bug: it ends the program with a line.
//
// Any thread may call both. Work runs without a lock of the queue. The owner and pending work keep a queue alive. Work
// that is pending when the executor has shut down is destroyed unrun. An idle queue is one block of at most 96 bytes,
// since every back end of every session has one.
//
// The owner of a queue says what it guards, and clang's analysis refuses every other use: fields are GUARDED_BY(*queue_),
// functions that run on the queue REQUIRES(*queue_), and each piece of work that is handed to it begins with
// assertCurrent().
#pragma once

#include <array>
#include <atomic>
#include <cassert>
#include <cstdint>
#include <memory>
#include <type_traits>
#include <vector>

#include "platform/base/Blocking.h"
#include "platform/base/Function.h"
#include "platform/base/Mutex.h"
#include "platform/queues/Executor.h"

namespace kyt {

class CAPABILITY("queue") SerialQueue : public std::enable_shared_from_this<SerialQueue> {
 public:
  // `label` must outlive the queue (a literal). `owner` groups queues of one user for the pool's fairness:
  // the pool limits the workers that the queues of one owner hold (0: the daemon itself, not limited).
  static std::shared_ptr<SerialQueue> create(const char* label, Executor& executor, uint64_t owner = 0);
  ~SerialQueue();
  SerialQueue(const SerialQueue&) = delete;
  SerialQueue& operator=(const SerialQueue&) = delete;

  void async(Task task);
  // As async(), but a turn does not keep the work: the executor gives it a worker at once. For long work that is to go on
  // beside the caller's.
  void asyncBeside(Task task);

  template <typename F>
  std::invoke_result_t<F&> sync(F&& f) EXCLUDES(this) {
    enter();
    struct Leave {
      SerialQueue& queue;
      ~Leave() { queue.leave(); }
    } leaveAtEnd{*this};
    return f();
  }

  // Whether the calling thread is running this queue's work now.
  [[nodiscard]] bool isCurrent() const noexcept;
  // What a piece of work says first, so that the analysis lets it touch what the queue guards. Costs nothing in a release
  // build.
  void assertCurrent() const ASSERT_CAPABILITY(this) { assert(isCurrent()); }

  [[nodiscard]] const char* label() const noexcept { return label_; }
  [[nodiscard]] uint64_t owner() const noexcept { return owner_; }
  [[nodiscard]] Executor& executor() const noexcept { return executor_; }

  // The owner of the queue that the calling thread runs for an executor, or 0; queues of the daemon itself that it runs
  // meanwhile do not count.
  [[nodiscard]] static uint64_t ownerOfThread() noexcept;

  // For executors. Runs what is pending when it begins, at most `kFairShare` pieces; what is left or came
  // meanwhile is submitted again, so that queues take turns. Returns at once when another thread is running
  // the queue.
  void runPending();
  // For executors that have shut down: destroys what is pending, unrun.
  void discardPending();

  static constexpr unsigned kFairShare = 256;

 private:
  friend class Turn;
  struct Node;
  struct Waiter;
  struct NodeCache;
  struct Concrete;
  SerialQueue(const char* label, Executor& executor, uint64_t owner);
  void submit(Task task, bool mayDefer);
  void enter();  // waits until this thread is the one that runs the queue, and runs what came before
  void leave();
  void enterContended();
  void enterAfterOthers();
  void leaveWithWork(bool mayDefer);
  bool takePending(bool keepsPromise = false);
  bool waitInLine(Waiter& waiter);
  void collect(uintptr_t state);
  void append(Node* newestFirst);
  void runReady(unsigned most);
  void grant();
  void schedule(std::shared_ptr<SerialQueue> self, bool mayDefer);

  // The state word holds the newest submitted node, whose links lead to older ones, and two flags: a thread
  // runs the queue; a turn or the executor has the queue and will call runPending(). Only the running thread
  // touches the rest. A thread gives up the running flag only when no caller of sync() waits: else it passes
  // the queue to the first one.
  std::atomic<uintptr_t> state_{0};
  std::atomic<const void*> runner_{nullptr};  // identifies the running thread
  Node* head_ = nullptr;                      // taken from the state word, oldest first
  Node* tail_ = nullptr;
  const char* label_;
  Executor& executor_;
  uint64_t owner_;
  uint32_t waiters_ = 0;  // callers of sync() in the list
};

// A stretch of work on one thread, at whose end the queues that were given work during it are run by this
// very thread. Nested turns join the outer one. runDeferred() may be called earlier (before a wait, say).
// While a turn blocks (BlockingScope), what it deferred is handed to the executor first, so that it never
// waits for the blocker.
class Turn final : private HeldBack {
 public:
  Turn();
  ~Turn();
  Turn(const Turn&) = delete;
  Turn& operator=(const Turn&) = delete;
  void runDeferred();
  static Turn* current() noexcept;  // the outermost one of this thread; null outside
  // Takes the first deferred queue out of the turn, for a caller that runs or submits it; null when there is none.
  [[nodiscard]] std::shared_ptr<SerialQueue> takeFirst();
  // Also calls what setBeforeBlocking() was given, so that nobody waits for what this turn holds back.
  void handDeferredToExecutors();
  // Called on this thread whenever the outermost turn is about to block, until it is set again (empty:
  // nothing). A connection sends the replies that it gathers for one write.
  void setBeforeBlocking(Task task);

 private:
  friend class SerialQueue;
  void defer(std::shared_ptr<SerialQueue> queue);
  void giveAway() override { handDeferredToExecutors(); }

  bool outermost_;
  size_t first_ = 0, end_ = 0;  // what is left to run of near_ with far_ behind it
  std::array<std::shared_ptr<SerialQueue>, 6> near_;
  std::vector<std::shared_ptr<SerialQueue>> far_;
  Task beforeBlocking_;
};

}  // namespace kyt
