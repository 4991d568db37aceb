// What follows when the text of a batch is made, for one back end: its compression, the request. A large batch is posted
// beside the session's queue, so that one busy program has two processors; the posts of a back end stay in their order. The
// text is made before: records would take three times its room while they wait, and are freed best where they were made. Used by HTTPSPostBackend, on its session's queue.
//
// A post holds all that it needs and nothing of the back end. At most `kMostWaiting` wait; who comes with another first does
// that work itself, or waits for it. Where many sessions are at work, all processors are, and each does its posts itself:
// what waits would only be held longer. The owner finishes the line before its session ends, so that nothing is under way that
// neither a session nor a request counts.
#pragma once

#include <atomic>
#include <cstddef>
#include <memory>

#include "platform/base/Function.h"
#include "platform/queues/SerialQueue.h"

namespace kyt {

class PostLine {
 public:
  static constexpr unsigned kMostWaiting = 2;
  // Below so many bytes of records the change of threads costs more than it gains: compressing them takes less than 0.1 ms.
  static constexpr size_t kLeastBytes = 32u << 10;

  explicit PostLine(Executor& executor) : executor_(executor) {}
  PostLine(const PostLine&) = delete;
  PostLine& operator=(const PostLine&) = delete;

  // Runs it after those that were added before, on another thread where one is soon free, else at once.
  void add(Function<void()> post);
  // Returns when all that was added has run. What has not begun runs on the caller's thread.
  void finish();

 private:
  Executor& executor_;
  std::shared_ptr<SerialQueue> queue_;              // made for the first
  std::shared_ptr<std::atomic<unsigned>> waiting_;  // have not begun
};

}  // namespace kyt
