// The other end of a datagram socket on loopback: a bare socket on a free port, which gives up waiting after
// half a minute.
#pragma once

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstdint>
#include <string>
#include <string_view>

#include "tests/support/Eventually.h"

namespace kyt {

class UDPPeer {
 public:
  explicit UDPPeer(uint16_t port = 0) : descriptor_(::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0)) {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    address.sin_port = htons(port);
    socklen_t size = sizeof address;
    // A port that was given up may be another program's for a moment.
    EXPECT_TRUE(eventually(
        [&] { return ::bind(descriptor_, reinterpret_cast<const sockaddr*>(&address), size) == 0; }));
    ::getsockname(descriptor_, reinterpret_cast<sockaddr*>(&address), &size);
    port_ = ntohs(address.sin_port);
    const timeval patience{30, 0};
    ::setsockopt(descriptor_, SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
  }
  ~UDPPeer() { ::close(descriptor_); }
  UDPPeer(const UDPPeer&) = delete;
  UDPPeer& operator=(const UDPPeer&) = delete;
  [[nodiscard]] uint16_t port() const { return port_; }
  std::string receive(uint16_t* from = nullptr) const {
    char buffer[2048];
    sockaddr_in sender{};
    socklen_t size = sizeof sender;
    const ssize_t got =
        ::recvfrom(descriptor_, buffer, sizeof buffer, 0, reinterpret_cast<sockaddr*>(&sender), &size);
    if (from != nullptr) *from = ntohs(sender.sin_port);
    return got < 0 ? "nothing" : std::string(buffer, static_cast<size_t>(got));
  }
  void sendTo(uint16_t port, std::string_view text) const {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    address.sin_port = htons(port);
    EXPECT_EQ(::sendto(descriptor_, text.data(), text.size(), 0, reinterpret_cast<sockaddr*>(&address),
                       sizeof address),
              static_cast<ssize_t>(text.size()));
  }

 private:
  int descriptor_;
  uint16_t port_ = 0;
};

}  // namespace kyt
