// Datagram sockets over IPv4: the dashboard back end's. The real ones are
// platform/linux/base/LinuxUDPSocket.h; platform/fake/FakeUDPSocket.h fails as it is told.
//
// A socket belongs to one serial queue (or to one thread) at a time; the factory may be called from any
// thread. Nothing here blocks: a send or a receive that would have to wait fails instead. Failures are the
// system's error numbers. Whether a socket has something to read is the reactor's matter
// (platform/Reactor.h).
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <span>
#include <variant>

namespace kyt {

// An open socket; closes at destruction.
class UDPSocket {
 public:
  virtual ~UDPSocket() = default;
  [[nodiscard]] virtual int descriptor() const = 0;
  // A send to a peer that is gone shall be an error, never a signal.
  virtual void suppressBrokenPipeSignal() = 0;
  // To the wildcard address and any free port. 0, or the error's number.
  [[nodiscard]] virtual int bindToAnyPort() = 0;
  // From now on datagrams go to this peer and come from nobody else. `address` has its first byte highest, as
  // ipv4Address() gives it. 0, or the error's number.
  [[nodiscard]] virtual int connect(uint32_t address, uint16_t port) = 0;
  // How many bytes went out, or the error's number negated.
  [[nodiscard]] virtual int64_t send(std::span<const std::byte> datagram) = 0;
  // How many bytes of the next datagram are in `buffer` (what has no room is lost), or the error's number
  // negated.
  [[nodiscard]] virtual int64_t receive(std::span<std::byte> buffer) = 0;
};

class UDPSocketFactory {
 public:
  virtual ~UDPSocketFactory() = default;
  // A socket, or the error's number.
  [[nodiscard]] virtual std::variant<std::unique_ptr<UDPSocket>, int> open() = 0;
  // Sockets not closed yet: the daemon is not idle while a session's last datagrams are still sent again.
  [[nodiscard]] virtual size_t openSockets() const = 0;
};

}  // namespace kyt
