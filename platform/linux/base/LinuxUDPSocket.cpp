#include "platform/linux/base/LinuxUDPSocket.h"

#include <errno.h>
#include <netinet/in.h>
#include <sys/socket.h>

#include "platform/linux/base/Descriptors.h"

namespace kyt {

namespace {

class LinuxUDPSocket final : public UDPSocket {
 public:
  LinuxUDPSocket(Descriptor socket, std::atomic<size_t>& open) : socket_(std::move(socket)), open_(open) {
    open_.fetch_add(1, std::memory_order_relaxed);
  }
  ~LinuxUDPSocket() override { open_.fetch_sub(1, std::memory_order_relaxed); }

  [[nodiscard]] int descriptor() const override { return socket_.get(); }
  // Here this is a flag of each send, not an option of the socket.
  void suppressBrokenPipeSignal() override { sendFlags_ |= MSG_NOSIGNAL; }
  [[nodiscard]] int bindToAnyPort() override {
    const sockaddr_in any = addressOf(INADDR_ANY, 0);
    return bind(socket_.get(), reinterpret_cast<const sockaddr*>(&any), sizeof any) == 0 ? 0 : errno;
  }
  [[nodiscard]] int connect(uint32_t address, uint16_t port) override {
    const sockaddr_in peer = addressOf(address, port);
    return ::connect(socket_.get(), reinterpret_cast<const sockaddr*>(&peer), sizeof peer) == 0 ? 0 : errno;
  }
  [[nodiscard]] int64_t send(std::span<const std::byte> datagram) override {
    const ssize_t sent = ::send(socket_.get(), datagram.data(), datagram.size(), sendFlags_);
    return sent >= 0 ? sent : -errno;
  }
  [[nodiscard]] int64_t receive(std::span<std::byte> buffer) override {
    const ssize_t received = recvfrom(socket_.get(), buffer.data(), buffer.size(), 0, nullptr, nullptr);
    return received >= 0 ? received : -errno;
  }

 private:
  static sockaddr_in addressOf(uint32_t address, uint16_t port) {
    sockaddr_in out{};
    out.sin_family = AF_INET;
    out.sin_addr.s_addr = htonl(address);
    out.sin_port = htons(port);
    return out;
  }
  const Descriptor socket_;
  std::atomic<size_t>& open_;
  int sendFlags_ = 0;
};

}  // namespace

std::variant<std::unique_ptr<UDPSocket>, int> LinuxUDPSocketFactory::open() {
  Descriptor made = ownDescriptor(socket(AF_INET, SOCK_DGRAM | SOCK_NONBLOCK | SOCK_CLOEXEC, IPPROTO_UDP));
  if (made.get() < 0) return errno;
  return std::make_unique<LinuxUDPSocket>(std::move(made), open_);
}

}  // namespace kyt
