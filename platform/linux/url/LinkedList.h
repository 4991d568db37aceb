// A doubly linked list through its members: T has a field `Links<T> links`, or another that is named. Owns nothing.
#pragma once

#include <utility>

namespace kyt {

template <typename T>
struct Links {
  T* previous = nullptr;
  T* next = nullptr;
};

struct UsualLinks {
  template <typename T>
  static Links<T>& of(T& member) {
    return member.links;
  }
};

template <typename T, typename Which = UsualLinks>
class LinkedList {
 public:
  [[nodiscard]] T* first() const { return first_; }
  [[nodiscard]] bool empty() const { return first_ == nullptr; }

  void append(T& member) {
    Which::of(member) = {last_, nullptr};
    (last_ != nullptr ? Which::of(*last_).next : first_) = &member;
    last_ = &member;
  }

  void remove(T& member) {
    const Links<T> links = std::exchange(Which::of(member), {});
    (links.previous != nullptr ? Which::of(*links.previous).next : first_) = links.next;
    (links.next != nullptr ? Which::of(*links.next).previous : last_) = links.previous;
  }

 private:
  T* first_ = nullptr;
  T* last_ = nullptr;
};

}  // namespace kyt
