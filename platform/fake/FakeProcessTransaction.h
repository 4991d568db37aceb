// Counts begin() and end(), and tells of a begin() while open or an end() while closed. Any thread.
#pragma once

#include <atomic>

#include "platform/ProcessTransaction.h"

namespace kyt {

class FakeProcessTransaction final : public ProcessTransaction {
 public:
  void begin() override {
    if (open_.exchange(true)) outOfOrder_ = true;
    ++begins_;
  }
  void end() override {
    if (!open_.exchange(false)) outOfOrder_ = true;
    ++ends_;
  }
  [[nodiscard]] bool isOpen() const { return open_; }
  [[nodiscard]] int begins() const { return begins_; }
  [[nodiscard]] int ends() const { return ends_; }
  [[nodiscard]] bool outOfOrder() const { return outOfOrder_; }

 private:
  std::atomic<bool> open_ = false, outOfOrder_ = false;
  std::atomic<int> begins_ = 0, ends_ = 0;
};

}  // namespace kyt
