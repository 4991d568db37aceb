#include "platform/linux/url/URLConnection.h"

#include <arpa/inet.h>
#include <linux/sockios.h>
#include <linux/tcp.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/ioctl.h>

#include <algorithm>
#include <cerrno>
#include <cstddef>
#include <cstring>

#include "platform/linux/base/Descriptors.h"
#include "platform/linux/url/URLTransfer.h"

namespace kyt {
namespace {

// The kernel's states of a connection: TCP_CLOSE, TCP_CLOSE_WAIT.
constexpr uint8_t kClosed = 7, kCloseWait = 8;

const sockaddr& generic(const sockaddr_storage& address) {
  return reinterpret_cast<const sockaddr&>(address);
}

bool isAddress(const sockaddr_storage& address, const char* text, int port) {
  char here[INET6_ADDRSTRLEN] = {};
  in_port_t number = 0;
  if (address.ss_family == AF_INET) {
    const auto& four = reinterpret_cast<const sockaddr_in&>(address);
    number = four.sin_port;
    inet_ntop(AF_INET, &four.sin_addr, here, sizeof here);
  } else if (address.ss_family == AF_INET6) {
    const auto& six = reinterpret_cast<const sockaddr_in6&>(address);
    number = six.sin6_port;
    inet_ntop(AF_INET6, &six.sin6_addr, here, sizeof here);
  } else {
    return false;
  }
  return ntohs(number) == port && std::strcmp(here, text) == 0;
}

sockaddr_storage nameOf(int socket, decltype(::getsockname)* get) {
  sockaddr_storage address{};
  socklen_t size = sizeof address;
  if (get(socket, reinterpret_cast<sockaddr*>(&address), &size) != 0) return {};
  return address;
}

struct Figures {
  uint8_t state;
  uint64_t acknowledged;
};

std::optional<Figures> figuresOf(int socket) {
  tcp_info info{};
  socklen_t size = sizeof info;
  if (getsockopt(socket, IPPROTO_TCP, TCP_INFO, &info, &size) != 0) return std::nullopt;
  if (size < offsetof(tcp_info, tcpi_bytes_acked) + sizeof info.tcpi_bytes_acked) return std::nullopt;
  return Figures{info.tcpi_state, info.tcpi_bytes_acked};
}

bool isUnspecified(const sockaddr_storage& address) {
  if (address.ss_family == AF_INET)
    return reinterpret_cast<const sockaddr_in&>(address).sin_addr.s_addr == INADDR_ANY;
  return std::memcmp(&reinterpret_cast<const sockaddr_in6&>(address).sin6_addr, &in6addr_any,
                     sizeof in6addr_any) == 0;
}

// Whether the address is one of this machine's.
bool isHere(sockaddr_storage address) {
  if (address.ss_family == AF_INET) reinterpret_cast<sockaddr_in&>(address).sin_port = 0;
  if (address.ss_family == AF_INET6) reinterpret_cast<sockaddr_in6&>(address).sin6_port = 0;
  const Descriptor probe = ownDescriptor(socket(address.ss_family, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  if (probe.get() < 0) return true;
  return bind(probe.get(), &generic(address), sizeof address) == 0 || errno != EADDRNOTAVAIL;
}

}  // namespace

std::optional<uint64_t> bytesWritten(int socket) {
  int unacknowledged = 0;
  const std::optional<Figures> figures = figuresOf(socket);
  if (!figures || ioctl(socket, SIOCOUTQ, &unacknowledged) != 0) return std::nullopt;
  return figures->acknowledged + static_cast<uint64_t>(unacknowledged);
}

bool URLConnection::isBetween(const char* local, int localPort, const char* peer, int peerPort) {
  if (isOver_) return false;
  if (connected_) return isAddress(local_, local, localPort) && isAddress(peer_, peer, peerPort);
  const sockaddr_storage here = nameOf(socket_, ::getsockname), there = nameOf(socket_, ::getpeername);
  connected_ = isAddress(here, local, localPort) && isAddress(there, peer, peerPort);
  if (!connected_) return false;
  local_ = here;
  peer_ = there;
  return true;
}

// Its number may be another's by now.
bool URLConnection::isStillThere() const {
  if (isOver_ || !connected_) return false;
  const sockaddr_storage local = nameOf(socket_, ::getsockname);
  return std::memcmp(&local, &local_, sizeof local) == 0;
}

URLConnection::Mark URLConnection::mark() const {
  const std::optional<uint64_t> written = isOver_ ? std::nullopt : bytesWritten(socket_);
  return written ? Mark{true, *written} : Mark{};
}

void URLConnection::look() {
  if (isOver_) return;
  const std::optional<Figures> figures = figuresOf(socket_);
  proves_ = figures.has_value();
  if (!figures) return;
  acknowledged_ = figures->acknowledged;
  peerEnded_ = peerEnded_ || figures->state == kCloseWait;
  if (figures->state == kClosed && !peerEnded_) proves_ = false;
}

bool URLConnection::hasAcknowledgedNothingBehind(const Mark& mark) {
  look();
  return mark.known && proves_ && acknowledged_ <= mark.written;
}

bool URLConnection::hasEnded() const {
  pollfd one{socket_, POLLIN | POLLRDHUP, 0};
  if (poll(&one, 1, 0) <= 0) return false;
  return (one.revents & (POLLRDHUP | POLLHUP | POLLERR)) != 0 || (isSilent && (one.revents & POLLIN) != 0);
}

void URLConnection::letGo() {
  if (!isStillThere()) return;
  shutdown(socket_, SHUT_RDWR);
  char bytes[4096];
  while (recv(socket_, bytes, sizeof bytes, MSG_DONTWAIT) > 0) continue;
}

void URLConnection::abort() {
  if (!isStillThere()) return;
  look();
  isOver_ = true;
  discard();
}

void URLConnection::abortWhatIsLeft() {
  look();
  const Mark now = mark();
  if (isOver_ || (now.known && acknowledged_ >= now.written)) return;
  abort();
}

// Resets the connection and empties what was to be sent.
void URLConnection::discard() const {
  sockaddr none{};
  none.sa_family = AF_UNSPEC;
  (void)connect(socket_, &none, sizeof none);
}

void URLConnection::closing() {
  if (isOver_) return;
  look();
  if (connected_ && !proves_) {
    // A reset of a connection whose peer had ended it is this error, any other's is another.
    int error = 0;
    socklen_t size = sizeof error;
    proves_ = getsockopt(socket_, SOL_SOCKET, SO_ERROR, &error, &size) == 0 && error == EPIPE;
  }
  isOver_ = true;
  const bool mayGoAgain = std::any_of(transfers.begin(), transfers.end(), [&](const URLTransfer* transfer) {
    return hasAcknowledgedNothingBehind(transfer->attempt.mark);
  });
  if (mayGoAgain) discard();
}

RouteTable::Way URLConnection::way(RouteTable& routes, bool avoidCellular) const {
  const sockaddr_storage local = connected_ ? local_ : nameOf(socket_, ::getsockname);
  // Closed by libcurl without a word, or its number is another's by now: not in the way of anything.
  if (local.ss_family != peer_.ss_family || isUnspecified(local)) return RouteTable::Way::same;
  if (!isHere(local)) return RouteTable::Way::none;
  return routes.wayOf(generic(local), generic(peer_), interface_, avoidCellular);
}

}  // namespace kyt
