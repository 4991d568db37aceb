#include "tools/demo/Ports.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>

#include <random>

#include "platform/linux/base/Descriptors.h"

namespace kyt::tools {
namespace {

// The system's own begin at 32768.
constexpr unsigned kFirst = 16384, kLast = 32767;
constexpr int kAttempts = 100;

sockaddr_in loopback(uint16_t port) {
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  address.sin_port = htons(port);
  return address;
}

}  // namespace

uint16_t freePort() {
  std::random_device random;
  std::uniform_int_distribution<unsigned> ports(kFirst, kLast);
  for (int attempt = 0; attempt < kAttempts; ++attempt) {
    const auto port = static_cast<uint16_t>(ports(random));
    const Descriptor trial = ownDescriptor(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    const sockaddr_in address = loopback(port);
    if (bind(trial.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0) return port;
  }
  return 0;
}

bool takesConnections(uint16_t port) {
  const Descriptor client = ownDescriptor(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
  const sockaddr_in address = loopback(port);
  return connect(client.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0;
}

}  // namespace kyt::tools
