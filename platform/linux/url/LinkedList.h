// A doubly linked list through its members: T has a field `Links<T> links`. Owns nothing.
#pragma once

namespace kyt {

template <typename T>
struct Links {
  T* previous = nullptr;
  T* next = nullptr;
};

template <typename T>
class LinkedList {
 public:
  [[nodiscard]] T* first() const { return first_; }
  [[nodiscard]] bool empty() const { return first_ == nullptr; }

  void append(T& member) {
    member.links = {last_, nullptr};
    (last_ != nullptr ? last_->links.next : first_) = &member;
    last_ = &member;
  }

  void remove(T& member) {
    (member.links.previous != nullptr ? member.links.previous->links.next : first_) = member.links.next;
    (member.links.next != nullptr ? member.links.next->links.previous : last_) = member.links.previous;
    member.links = {};
  }

 private:
  T* first_ = nullptr;
  T* last_ = nullptr;
};

}  // namespace kyt
