// While it lives, this process can open nothing more: the limit on descriptors is below the number that are open.
#pragma once

#include <sys/resource.h>

#include <stdexcept>

namespace kyt {

class NoDescriptors {
 public:
  NoDescriptors() {
    if (::getrlimit(RLIMIT_NOFILE, &former_) != 0) throw std::runtime_error("getrlimit");
    const rlimit none{0, former_.rlim_max};
    if (::setrlimit(RLIMIT_NOFILE, &none) != 0) throw std::runtime_error("setrlimit");
  }
  ~NoDescriptors() { ::setrlimit(RLIMIT_NOFILE, &former_); }
  NoDescriptors(const NoDescriptors&) = delete;
  NoDescriptors& operator=(const NoDescriptors&) = delete;

 private:
  rlimit former_ = {};
};

}  // namespace kyt
