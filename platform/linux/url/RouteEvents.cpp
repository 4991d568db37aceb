#include "platform/linux/url/RouteEvents.h"

#include <linux/netlink.h>
#include <linux/rtnetlink.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>

namespace kyt {

bool RouteEvents::subscribe() {
  if (socket_ >= 0) return true;
  socket_ = socket(AF_NETLINK, SOCK_RAW | SOCK_CLOEXEC | SOCK_NONBLOCK, NETLINK_ROUTE);
  if (socket_ < 0) return false;
  sockaddr_nl address{};
  address.nl_family = AF_NETLINK;
  address.nl_groups =
      RTMGRP_LINK | RTMGRP_IPV4_ROUTE | RTMGRP_IPV6_ROUTE | RTMGRP_IPV4_IFADDR | RTMGRP_IPV6_IFADDR;
  if (bind(socket_, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0) return true;
  unsubscribe();
  return false;
}

void RouteEvents::unsubscribe() {
  if (socket_ >= 0) close(socket_);
  socket_ = -1;
}

bool RouteEvents::takeAll() {
  if (socket_ < 0) return false;
  char bytes[16384];
  bool any = false;
  for (;;) {
    const bool came = recv(socket_, bytes, sizeof bytes, 0) >= 0 || errno == ENOBUFS;  // the latter: too many
    any = any || came;
    if (!came && errno != EINTR) return any;
  }
}

}  // namespace kyt
