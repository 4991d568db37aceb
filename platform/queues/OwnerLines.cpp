#include "platform/queues/OwnerLines.h"

#include <algorithm>
#include <utility>

#include "platform/queues/SerialQueue.h"

namespace kyt {

void OwnerLines::push(Queue queue) {
  const uint64_t owner = queue->owner();
  std::deque<Queue>& line = lines_[owner];
  if (line.empty()) turns_.push_back(owner);
  line.push_back(std::move(queue));
  ++count_;
}

void OwnerLines::pushFirst(Queue queue) {
  const uint64_t owner = queue->owner();
  std::deque<Queue>& line = lines_[owner];
  if (!line.empty()) turns_.erase(std::find(turns_.begin(), turns_.end(), owner));
  turns_.push_front(owner);
  line.push_front(std::move(queue));
  ++count_;
}

OwnerLines::Queue OwnerLines::pop() {
  if (turns_.empty()) return nullptr;
  const uint64_t owner = turns_.front();
  turns_.pop_front();
  const auto found = lines_.find(owner);
  std::deque<Queue>& line = found->second;
  Queue queue = std::move(line.front());
  line.pop_front();
  --count_;
  if (!line.empty())
    turns_.push_back(owner);
  else if (lines_.size() > kMostKept)
    lines_.erase(found);
  return queue;
}

std::vector<OwnerLines::Queue> OwnerLines::takeAll() {
  std::vector<Queue> all;
  all.reserve(count_);
  while (!empty()) all.push_back(pop());
  return all;
}

}  // namespace kyt
