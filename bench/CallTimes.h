// How long calls take that are accepted. One that is refused, since a queue is full, returns at once and would make the
// others look quick: it counts as refused, and its time not at all. One thread.
#pragma once

#include <algorithm>
#include <chrono>
#include <cstddef>
#include <utility>
#include <vector>

namespace kyt::bench {

class CallTimes {
 public:
  // Calls it; true: it was accepted. Returns that.
  template <typename Call>
  bool time(Call&& call) {
    const auto begin = std::chrono::steady_clock::now();
    const bool accepted = std::forward<Call>(call)();
    const std::chrono::duration<double, std::micro> spent = std::chrono::steady_clock::now() - begin;
    if (accepted)
      microseconds_.push_back(spent.count());
    else
      ++refused_;
    return accepted;
  }
  [[nodiscard]] size_t accepted() const { return microseconds_.size(); }
  [[nodiscard]] size_t refused() const { return refused_; }
  // What that part of the accepted calls took at most, in microseconds: 0.5 is the median. 0 where there is none.
  [[nodiscard]] double most(double part) {
    if (microseconds_.empty()) return 0;
    std::sort(microseconds_.begin(), microseconds_.end());
    const auto at = static_cast<size_t>(part * static_cast<double>(microseconds_.size()));
    return microseconds_[std::min(at, microseconds_.size() - 1)];
  }

 private:
  std::vector<double> microseconds_;
  size_t refused_ = 0;
};

}  // namespace kyt::bench
