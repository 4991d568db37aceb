#include "platform/linux/url/RouteEvents.h"

#include <linux/netlink.h>
#include <linux/rtnetlink.h>
#include <sys/socket.h>

#include <cerrno>
#include <utility>

#include "platform/linux/base/Descriptors.h"

namespace kyt {

bool RouteEvents::subscribe() {
  if (descriptor() >= 0) return true;
  Descriptor made = ownDescriptor(socket(AF_NETLINK, SOCK_RAW | SOCK_CLOEXEC | SOCK_NONBLOCK, NETLINK_ROUTE));
  sockaddr_nl address{};
  address.nl_family = AF_NETLINK;
  address.nl_groups =
      RTMGRP_LINK | RTMGRP_IPV4_ROUTE | RTMGRP_IPV6_ROUTE | RTMGRP_IPV4_IFADDR | RTMGRP_IPV6_IFADDR;
  if (made.get() < 0 || bind(made.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0)
    return false;
  socket_ = std::move(made);
  return true;
}

bool RouteEvents::takeAll() {
  if (descriptor() < 0) return false;
  char bytes[16384];
  bool any = false;
  for (;;) {
    const bool came =
        recv(descriptor(), bytes, sizeof bytes, 0) >= 0 || errno == ENOBUFS;  // the latter: too many
    any = any || came;
    if (!came && errno != EINTR) return any;
  }
}

}  // namespace kyt
