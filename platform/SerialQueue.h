// Serial task queues: work runs one piece at a time in the order it was submitted, whatever threads run it. Every
// stateful object of the daemon belongs to one.
//
// - async(): the work runs later. On a thread that is inside a Turn (a connection's worker handling what its client
//   sent) an idle queue wakes no other thread: the turn runs the queue at its end at the latest. Elsewhere the
//   executor is asked for a worker.
// - sync(): runs the work before returning, on the caller's own thread. Waits while another thread is running the
//   queue; work that was submitted earlier and has not begun is run first, by the caller itself. On an idle queue it
//   costs one uncontended atomic exchange each way. A synchronous call from a queue onto itself is a bug and is
//   asserted.
//
// Work holds no lock of the queue while it runs. Callable from any thread. A queue is kept alive by its owner and by
// pending work; work that is pending when the executor has shut down is destroyed unrun. Small on purpose: an idle
// queue is one block of at most 96 bytes, since every back end of every session has one.
#pragma once

#include <memory>
#include <optional>
#include <type_traits>

#include "platform/Executor.h"
#include "platform/Function.h"
#include "platform/Mutex.h"

namespace kyt {

class CAPABILITY("queue") SerialQueue : public std::enable_shared_from_this<SerialQueue> {
 public:
  // `label` must outlive the queue (a literal). `owner` groups queues of one user for the pool's fairness: the pool
  // lets the queues of one owner hold at most half of its workers (0: the daemon itself, not limited).
  static std::shared_ptr<SerialQueue> create(const char* label, Executor& executor, uint64_t owner = 0);
  ~SerialQueue();
  SerialQueue(const SerialQueue&) = delete;
  SerialQueue& operator=(const SerialQueue&) = delete;

  void async(Task task);

  template <typename F>
  auto sync(F&& f) -> std::invoke_result_t<F&> {
    enter();
    struct Leave {
      SerialQueue& queue;
      ~Leave() { queue.leave(); }
    } leaveAtEnd{*this};
    return f();
  }

  // Whether the calling thread is running this queue's work now.
  [[nodiscard]] bool isCurrent() const noexcept;
  void assertCurrent() const ASSERT_CAPABILITY(this);

  [[nodiscard]] const char* label() const noexcept { return label_; }
  [[nodiscard]] uint64_t owner() const noexcept { return owner_; }

  // For executors: runs what is pending until the queue is empty, or until `fairShare` pieces ran (then it submits
  // itself again). Returns at once when another thread is running the queue.
  void runPending();

 private:
  friend class Turn;
  struct Node;
  SerialQueue(const char* label, Executor& executor, uint64_t owner);
  void enter();  // waits until this thread is the one that runs the queue, and runs what came before
  void leave();
  // The representation belongs to SerialQueue.cpp.
  Mutex mutex_;
  Node* head_ GUARDED_BY(mutex_) = nullptr;
  Node* tail_ GUARDED_BY(mutex_) = nullptr;
  bool running_ GUARDED_BY(mutex_) = false;
  bool scheduled_ GUARDED_BY(mutex_) = false;
  uint16_t waiters_ GUARDED_BY(mutex_) = 0;
  const char* label_;
  Executor& executor_;
  uint64_t owner_;
};

// A stretch of work on one thread, at whose end the queues that were given work during it are run by this very
// thread. Nested turns join the outer one. runDeferred() may be called earlier (before a wait, say). While a turn
// blocks (BlockingScope), what it deferred is handed to the executor first, so that it never waits for the blocker.
class Turn {
 public:
  Turn();
  ~Turn();
  Turn(const Turn&) = delete;
  Turn& operator=(const Turn&) = delete;
  void runDeferred();
  static Turn* current() noexcept;
  void handDeferredToExecutors();

 private:
  friend class SerialQueue;
  Turn* outer_;
  std::shared_ptr<SerialQueue> first_;  // representation may change in SerialQueue.cpp's favour
  struct More;
  std::unique_ptr<More> more_;
};

}  // namespace kyt
