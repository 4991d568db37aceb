#include "platform/ipc/OutgoingBytes.h"

#include <utility>

namespace kyt {

std::string& OutgoingBytes::end() {
  if (last_.size() >= kFull) {
    fullBytes_ += last_.size();
    full_.push_back(std::move(last_));
    last_ = {};
    last_.reserve(kRoom);
  }
  return last_;
}

std::string_view OutgoingBytes::front() const {
  return std::string_view(hasFull() ? full_[next_] : last_).substr(written_);
}

void OutgoingBytes::remove(size_t bytes) {
  written_ += bytes;
  std::string& first = hasFull() ? full_[next_] : last_;
  if (written_ < first.size()) return;
  written_ = 0;
  if (hasFull()) {
    fullBytes_ -= first.size();
    ++next_;
  }
  first = std::string();
  if (!hasFull()) {
    full_ = {};
    next_ = 0;
  }
}

}  // namespace kyt
