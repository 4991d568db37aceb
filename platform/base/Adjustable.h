// A number that may be changed while others read it: each reads the old one or the new, and nothing else follows from it.
// Any thread; costs what a plain number does.
#pragma once

#include <atomic>

namespace kyt {

template <typename Number>
class Adjustable {
 public:
  Adjustable(Number number = {})
      : number_(number) {}  // NOLINT(google-explicit-constructor): stands for a number
  Adjustable(const Adjustable& other) : number_(Number(other)) {}
  Adjustable& operator=(const Adjustable& other) { return *this = Number(other); }
  Adjustable& operator=(Number number) {
    number_.store(number, std::memory_order_relaxed);
    return *this;
  }
  operator Number() const {  // NOLINT(google-explicit-constructor)
    return number_.load(std::memory_order_relaxed);
  }

 private:
  std::atomic<Number> number_;
};

}  // namespace kyt
