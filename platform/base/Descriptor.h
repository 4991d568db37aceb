// An open descriptor of the operating system, owned. Move-only; closes at destruction with the function that
// it was made with, so that those who only hold or hand it on need nothing of the system.
#pragma once

#include <utility>

namespace kyt {

class Descriptor {
 public:
  Descriptor() = default;
  Descriptor(int fd, void (*closer)(int)) : fd_(fd), closer_(closer) {}
  Descriptor(Descriptor&& other) noexcept : fd_(std::exchange(other.fd_, -1)), closer_(other.closer_) {}
  Descriptor& operator=(Descriptor&& other) noexcept {
    std::swap(fd_, other.fd_);
    std::swap(closer_, other.closer_);
    return *this;
  }
  ~Descriptor() {
    if (fd_ >= 0 && closer_ != nullptr) closer_(fd_);
  }
  [[nodiscard]] int get() const { return fd_; }
  explicit operator bool() const { return fd_ >= 0; }
  [[nodiscard]] int release() { return std::exchange(fd_, -1); }

 private:
  int fd_ = -1;
  void (*closer_)(int) = nullptr;
};

}  // namespace kyt
