#include "tests/support/PacketCapture.h"

#include <arpa/inet.h>
#include <linux/if_packet.h>
#include <net/ethernet.h>
#include <netinet/ip.h>
#include <netinet/ip6.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <stdexcept>

namespace kyt {
namespace {

constexpr int kBufferBytes = 16 << 20;

std::string text(int family, const void* address) {
  std::array<char, INET6_ADDRSTRLEN> buffer{};
  return inet_ntop(family, address, buffer.data(), buffer.size());
}

}  // namespace

PacketCapture::PacketCapture(const NetworkNamespace& space) {
  const NetworkNamespace::Entered entered(space);
  socket_ = socket(AF_PACKET, SOCK_DGRAM | SOCK_NONBLOCK | SOCK_CLOEXEC, htons(ETH_P_ALL));
  if (socket_ < 0) throw std::runtime_error("PacketCapture: not permitted");
  static_cast<void>(setsockopt(socket_, SOL_SOCKET, SO_RCVBUFFORCE, &kBufferBytes, sizeof kBufferBytes));
}

PacketCapture::~PacketCapture() {
  close(socket_);
}

const std::set<std::string>& PacketCapture::peers() {
  std::array<char, sizeof(ip6_hdr)> head{};
  for (;;) {
    sockaddr_ll from{};
    socklen_t length = sizeof from;
    const ssize_t read =
        recvfrom(socket_, head.data(), head.size(), 0, reinterpret_cast<sockaddr*>(&from), &length);
    if (read < 0 && errno == EINTR) continue;
    if (read < 0) break;
    const bool sent = from.sll_pkttype == PACKET_OUTGOING;
    if (from.sll_protocol == htons(ETH_P_IP) && read >= static_cast<ssize_t>(sizeof(iphdr))) {
      const auto* header = reinterpret_cast<const iphdr*>(head.data());
      peers_.insert(text(AF_INET, sent ? &header->daddr : &header->saddr));
    } else if (from.sll_protocol == htons(ETH_P_IPV6) && read == static_cast<ssize_t>(head.size())) {
      const auto* header = reinterpret_cast<const ip6_hdr*>(head.data());
      peers_.insert(text(AF_INET6, sent ? &header->ip6_dst : &header->ip6_src));
    }
  }
  tpacket_stats lost{};
  socklen_t length = sizeof lost;
  if (getsockopt(socket_, SOL_PACKET, PACKET_STATISTICS, &lost, &length) != 0 || lost.tp_drops != 0)
    throw std::runtime_error("PacketCapture: packets were lost");
  return peers_;
}

}  // namespace kyt
