// Datagram sockets of the system, non-blocking, closed on exec.
#pragma once

#include <atomic>

#include "platform/UDPSocket.h"

namespace kyt {

// Outlives its sockets.
class LinuxUDPSocketFactory final : public UDPSocketFactory {
 public:
  [[nodiscard]] std::variant<std::unique_ptr<UDPSocket>, int> open() override;
  [[nodiscard]] size_t openSockets() const override { return open_.load(std::memory_order_relaxed); }

 private:
  std::atomic<size_t> open_{0};
};

}  // namespace kyt
