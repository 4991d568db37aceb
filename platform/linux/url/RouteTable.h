// What the kernel says about the way to an address: whether there is a route, over which interface, and
// whether that interface is a cellular one. The network thread asks before it lets a request wait for
// connectivity, and before it opens a connection for a request that may not use cellular interfaces.
//
// One query socket, opened at first use; an answer costs two system calls and never waits, since the kernel
// answers before the question's call returns. One thread at a time. Where no query socket can be had, every
// address counts as reachable over an unknown interface, and requests are not held back.
#pragma once

#include <sys/socket.h>

#include <cstdint>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/base/Descriptor.h"

namespace kyt {

class RouteTable {
 public:
  // `cellularInterfaces`: shell patterns of interface names. `sysClassNet`: where the kernel describes
  // interfaces.
  RouteTable(std::vector<std::string> cellularInterfaces, std::string sysClassNet, std::string resolverFile);

  void setCellularInterfaces(std::vector<std::string> patterns) { cellularInterfaces_ = std::move(patterns); }

  // Whether a packet to the address would leave now; with `avoidCellular`, whether it can over another
  // interface.
  [[nodiscard]] bool isReachable(const sockaddr& address, bool avoidCellular);
  // An interface, not cellular, over which the address can be reached: the preferred route's, or that of a
  // less preferred one when only this avoids cellular interfaces. Empty text: reachable, the interface is
  // unknown.
  [[nodiscard]] std::optional<std::string> interfaceAvoidingCellular(const sockaddr& address);
  // How a connection to `peer` made now would leave, compared with one that is there between `local` and it, bound to
  // `interface` (empty: to none).
  enum class Way : uint8_t { same, other, none };
  [[nodiscard]] Way wayOf(const sockaddr& local, const sockaddr& peer, const std::string& interface,
                          bool avoidCellular);
  // Whether a name could be looked up: a name server that is not on this machine has a route, or one that is
  // here could ask others because there is a default route.
  [[nodiscard]] bool canResolve();
  // Whether the kernel marks the interface as wireless wide area, or a pattern matches its name.
  [[nodiscard]] bool isCellular(const std::string& interface) const;

 private:
  // The outgoing interface's index of a route (0: unknown), or nothing. `through`: only this
  // interface; 0: any. `source`: the address that packets leave from, when it is known.
  [[nodiscard]] std::optional<int> lookUp(const sockaddr& address, int through, sockaddr_storage* source);
  // … of one whose cable is plugged in: the kernel keeps routes over links that lost their carrier.
  [[nodiscard]] std::optional<int> usableRoute(const sockaddr& address, int through,
                                               sockaddr_storage* source = nullptr);
  [[nodiscard]] bool hasCarrier(int interface);
  [[nodiscard]] bool hasDefaultRoute();

  std::vector<std::string> cellularInterfaces_;
  std::string sysClassNet_, resolverFile_;
  Descriptor socket_, flagsSocket_;
  unsigned sequence_ = 0;
};

}  // namespace kyt
