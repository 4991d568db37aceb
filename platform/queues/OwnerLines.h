// Serial queues that wait for a thread, each owner's in a line of its own. The owners take turns: however many queues one
// user's clients have made ready, the first one of another user's is at most one place behind each owner's. Within a line
// the order is that of submission. Queues of the daemon itself (owner 0) are a line like the others.
//
// One thread at a time: the pool's, under its mutex.
#pragma once

#include <cstddef>
#include <cstdint>
#include <deque>
#include <memory>
#include <unordered_map>
#include <vector>

namespace kyt {

class SerialQueue;

class OwnerLines {
 public:
  using Queue = std::shared_ptr<SerialQueue>;

  void push(Queue queue);
  void pushFirst(Queue queue);  // before all others, of whatever owner
  [[nodiscard]] Queue pop();    // null when there is none
  [[nodiscard]] bool empty() const { return count_ == 0; }
  [[nodiscard]] size_t size() const { return count_; }
  [[nodiscard]] std::vector<Queue> takeAll();

 private:
  // Empty lines are kept, since most owners' queues come again at once.
  static constexpr size_t kMostKept = 64;

  std::unordered_map<uint64_t, std::deque<Queue>> lines_;
  std::deque<uint64_t> turns_;  // owners with waiting queues, the next one first
  size_t count_ = 0;
};

}  // namespace kyt
