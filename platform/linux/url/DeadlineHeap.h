// The deadlines of the network thread, soonest first: one binary heap whose entries live inside their owners,
// so that setting and cancelling a time-out, which every request does several times, allocates nothing.
// Network thread only.
#pragma once

#include <cstddef>
#include <utility>
#include <vector>

#include "platform/base/Clock.h"

namespace kyt {

class DeadlineHeap;

// One deadline. `fire`, a member function of the owner, runs once when it has passed, with the deadline no longer set; it may set it again,
// set or cancel others, and destroy the owner.
class Deadline {
 public:
  template <auto fire, typename Owner>
  [[nodiscard]] static Deadline calling(DeadlineHeap& heap, Owner& owner) {
    return Deadline(
        heap, [](void* at) { (static_cast<Owner*>(at)->*fire)(); }, &owner);
  }
  ~Deadline() { cancel(); }
  Deadline(const Deadline&) = delete;
  Deadline& operator=(const Deadline&) = delete;
  inline void set(MonotonicTime time);
  inline void cancel();
  [[nodiscard]] bool isSet() const { return index_ != kNotSet; }

 private:
  friend class DeadlineHeap;
  static constexpr size_t kNotSet = static_cast<size_t>(-1);
  Deadline(DeadlineHeap& heap, void (*fire)(void* owner), void* owner)
      : heap_(heap), fire_(fire), owner_(owner) {}
  DeadlineHeap& heap_;
  void (*fire_)(void*);
  void* owner_;
  MonotonicTime time_;
  size_t index_ = kNotSet;
};

class DeadlineHeap {
 public:
  // Milliseconds until the soonest, rounded up; -1 when there is none.
  [[nodiscard]] int millisecondsFrom(MonotonicTime now) const {
    if (heap_.empty()) return -1;
    const auto left = std::chrono::ceil<std::chrono::milliseconds>(heap_.front()->time_ - now).count();
    return left < 0 ? 0 : static_cast<int>(left < 3600000 ? left : 3600000);
  }

  // At most as many as are set now: one that sets itself anew waits for the next call, after sockets had
  // their turn.
  void fireUntil(MonotonicTime now) {
    for (size_t left = heap_.size(); left > 0 && !heap_.empty() && heap_.front()->time_ <= now; --left) {
      Deadline& soonest = *heap_.front();
      remove(soonest);
      soonest.fire_(soonest.owner_);
    }
  }

 private:
  friend class Deadline;
  void set(Deadline& deadline, MonotonicTime time) {
    deadline.time_ = time;
    if (!deadline.isSet()) {
      deadline.index_ = heap_.size();
      heap_.push_back(&deadline);
    }
    restore(deadline.index_);
  }

  void remove(Deadline& deadline) {
    const size_t index = std::exchange(deadline.index_, Deadline::kNotSet);
    Deadline* last = heap_.back();
    heap_.pop_back();
    if (last == &deadline) return;
    place(index, last);
    restore(index);
  }

  void place(size_t index, Deadline* deadline) {
    heap_[index] = deadline;
    deadline->index_ = index;
  }

  // Moves the entry at `index` to where it belongs.
  void restore(size_t index) {
    Deadline* moved = heap_[index];
    while (index > 0 && moved->time_ < heap_[(index - 1) / 2]->time_) {
      place(index, heap_[(index - 1) / 2]);
      index = (index - 1) / 2;
    }
    for (size_t child; (child = 2 * index + 1) < heap_.size(); index = child) {
      if (child + 1 < heap_.size() && heap_[child + 1]->time_ < heap_[child]->time_) ++child;
      if (moved->time_ <= heap_[child]->time_) break;
      place(index, heap_[child]);
    }
    place(index, moved);
  }

  std::vector<Deadline*> heap_;
};

void Deadline::set(MonotonicTime time) {
  heap_.set(*this, time);
}
void Deadline::cancel() {
  if (isSet()) heap_.remove(*this);
}

}  // namespace kyt
