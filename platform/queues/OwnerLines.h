// What waits for its turn, each owner's in a line of its own. The owners take turns: however many one user's clients have
// put there, the first one of another user's is at most one place behind each owner's. Within a line the order is that of
// arrival. What is the daemon's own (owner 0) is a line like the others.
//
// The worker pool keeps its ready queues so, the URL network the requests that may not go yet. `Owned` has an owner().
// One thread at a time.
#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <memory>
#include <unordered_map>
#include <utility>
#include <vector>

namespace kyt {

template <typename Owned>
class OwnerLines {
 public:
  using Item = std::shared_ptr<Owned>;

  void push(Item item);
  void pushFirst(Item item);  // before all others, of whatever owner
  [[nodiscard]] Item pop();   // null when there is none
  // The first one of the owners of which `mayGo(owner)` is true; the others keep their turn.
  template <typename MayGo>
  [[nodiscard]] Item pop(MayGo mayGo);
  template <typename MayGo>
  [[nodiscard]] bool has(MayGo mayGo) const {
    return std::any_of(turns_.begin(), turns_.end(), mayGo);
  }
  [[nodiscard]] bool empty() const { return count_ == 0; }
  [[nodiscard]] size_t size() const { return count_; }
  [[nodiscard]] std::vector<Item> takeAll();

 private:
  // Empty lines are kept, since most owners come again at once.
  static constexpr size_t kMostKept = 64;

  std::unordered_map<uint64_t, std::deque<Item>> lines_;
  std::deque<uint64_t> turns_;  // owners that something waits for, the next one first
  size_t count_ = 0;
};

template <typename Owned>
void OwnerLines<Owned>::push(Item item) {
  const uint64_t owner = item->owner();
  std::deque<Item>& line = lines_[owner];
  if (line.empty()) turns_.push_back(owner);
  line.push_back(std::move(item));
  ++count_;
}

template <typename Owned>
void OwnerLines<Owned>::pushFirst(Item item) {
  const uint64_t owner = item->owner();
  std::deque<Item>& line = lines_[owner];
  if (!line.empty()) turns_.erase(std::find(turns_.begin(), turns_.end(), owner));
  turns_.push_front(owner);
  line.push_front(std::move(item));
  ++count_;
}

template <typename Owned>
typename OwnerLines<Owned>::Item OwnerLines<Owned>::pop() {
  return pop([](uint64_t) { return true; });
}

template <typename Owned>
template <typename MayGo>
typename OwnerLines<Owned>::Item OwnerLines<Owned>::pop(MayGo mayGo) {
  const auto turn = std::find_if(turns_.begin(), turns_.end(), mayGo);
  if (turn == turns_.end()) return nullptr;
  const uint64_t owner = *turn;
  turns_.erase(turn);
  const auto found = lines_.find(owner);
  std::deque<Item>& line = found->second;
  Item item = std::move(line.front());
  line.pop_front();
  --count_;
  if (!line.empty())
    turns_.push_back(owner);
  else if (lines_.size() > kMostKept)
    lines_.erase(found);
  return item;
}

template <typename Owned>
std::vector<typename OwnerLines<Owned>::Item> OwnerLines<Owned>::takeAll() {
  std::vector<Item> all;
  all.reserve(count_);
  while (!empty()) all.push_back(pop());
  return all;
}

}  // namespace kyt
