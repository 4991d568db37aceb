// Datagram sockets in memory, for tests: they keep what was sent, hand out what a test puts in, and fail as
// they are told. One thread at a time.
#pragma once

#include <deque>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/UDPSocket.h"

namespace kyt {

class FakeUDPSockets final : public UDPSocketFactory {
 public:
  // Error numbers with which the next operations of that kind fail, 0: they succeed.
  struct Faults {
    int open = 0, bind = 0, connect = 0, send = 0;
    std::optional<size_t> sendOnly;  // a send takes no more than so many bytes
  };
  // What happened to one socket, kept after its end.
  struct Record {
    int descriptor = 0;
    bool open = true, brokenPipeSuppressed = false, bound = false;
    std::optional<uint32_t> address;
    uint16_t port = 0;
    std::vector<std::string> sent;     // whole datagrams that went out in full
    size_t attempts = 0;               // sends, failed ones included
    std::deque<std::string> arriving;  // what receive() hands out
  };
  static constexpr int kFirstDescriptor = 100;
  // What a system without the right to broadcast answers to a connect() with the address of all ones.
  static constexpr int kAccessDenied = 13;
  static constexpr int kWouldBlock = 11;

  [[nodiscard]] std::variant<std::unique_ptr<UDPSocket>, int> open() override;
  [[nodiscard]] size_t openSockets() const override;

  [[nodiscard]] size_t made() const { return sockets_.size(); }
  // In the order of their making; the last one without a number. Precondition: there is one.
  [[nodiscard]] Record& socket(size_t index) const { return *sockets_[index]; }
  [[nodiscard]] Record& last() const { return *sockets_.back(); }

  Faults faults;

 private:
  class Socket;
  std::vector<std::shared_ptr<Record>> sockets_;
};

}  // namespace kyt
