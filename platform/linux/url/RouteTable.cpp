#include "platform/linux/url/RouteTable.h"

#include <arpa/inet.h>
#include <fnmatch.h>
#include <linux/netlink.h>
#include <linux/rtnetlink.h>
#include <net/if.h>
#include <netinet/in.h>
#include <sys/ioctl.h>

#include <cerrno>
#include <cstring>
#include <fstream>
#include <memory>

#include "platform/linux/base/Descriptors.h"

namespace kyt {
namespace {

struct RouteQuestion {
  nlmsghdr header;
  rtmsg route;
  char attributes[64];

  void add(unsigned short type, const void* bytes, size_t size) {
    auto* attribute =
        reinterpret_cast<rtattr*>(reinterpret_cast<char*>(this) + NLMSG_ALIGN(header.nlmsg_len));
    attribute->rta_type = type;
    attribute->rta_len = static_cast<unsigned short>(RTA_LENGTH(size));
    std::memcpy(RTA_DATA(attribute), bytes, size);
    header.nlmsg_len = static_cast<unsigned>(NLMSG_ALIGN(header.nlmsg_len) + RTA_ALIGN(attribute->rta_len));
  }
};

// Only addresses: no ports.
bool sameAddress(const sockaddr& a, const sockaddr_storage& b) {
  if (a.sa_family != b.ss_family) return false;
  if (a.sa_family == AF_INET)
    return std::memcmp(&reinterpret_cast<const sockaddr_in&>(a).sin_addr,
                       &reinterpret_cast<const sockaddr_in&>(b).sin_addr, 4) == 0;
  return std::memcmp(&reinterpret_cast<const sockaddr_in6&>(a).sin6_addr,
                     &reinterpret_cast<const sockaddr_in6&>(b).sin6_addr, 16) == 0;
}

void takeSource(const rtmsg& route, const rtattr* attribute, sockaddr_storage& source) {
  source.ss_family = route.rtm_family;
  if (route.rtm_family == AF_INET && RTA_PAYLOAD(attribute) == 4)
    std::memcpy(&reinterpret_cast<sockaddr_in&>(source).sin_addr, RTA_DATA(attribute), 4);
  else if (route.rtm_family == AF_INET6 && RTA_PAYLOAD(attribute) == 16)
    std::memcpy(&reinterpret_cast<sockaddr_in6&>(source).sin6_addr, RTA_DATA(attribute), 16);
  else
    source.ss_family = AF_UNSPEC;
}

// The answer's interface when the route is one that carries packets.
std::optional<int> usableInterface(const nlmsghdr* header, sockaddr_storage* source) {
  if (header->nlmsg_type != RTM_NEWROUTE) return std::nullopt;  // an error: no route
  const auto* route = static_cast<const rtmsg*>(NLMSG_DATA(header));
  const bool carries = route->rtm_type == RTN_UNICAST || route->rtm_type == RTN_LOCAL ||
                       route->rtm_type == RTN_ANYCAST || route->rtm_type == RTN_BROADCAST ||
                       route->rtm_type == RTN_MULTICAST;
  if (!carries) return std::nullopt;
  int interface = 0;
  auto left = static_cast<unsigned>(RTM_PAYLOAD(header));
  for (const rtattr* attribute = RTM_RTA(route); RTA_OK(attribute, left);
       attribute = RTA_NEXT(attribute, left)) {
    if (attribute->rta_type == RTA_OIF) std::memcpy(&interface, RTA_DATA(attribute), sizeof interface);
    if (attribute->rta_type == RTA_PREFSRC && source != nullptr) takeSource(*route, attribute, *source);
  }
  return interface;
}

std::string nameOf(int interface) {
  char name[IF_NAMESIZE] = {};
  return interface != 0 && if_indextoname(static_cast<unsigned>(interface), name) != nullptr ? name : "";
}

sockaddr_storage parseAddress(int family, const char* text) {
  sockaddr_storage storage{};
  storage.ss_family = static_cast<sa_family_t>(family);
  void* place = family == AF_INET ? static_cast<void*>(&reinterpret_cast<sockaddr_in&>(storage).sin_addr)
                                  : &reinterpret_cast<sockaddr_in6&>(storage).sin6_addr;
  if (inet_pton(family, text, place) != 1) storage.ss_family = AF_UNSPEC;
  return storage;
}

const sockaddr& generic(const sockaddr_storage& storage) {
  return reinterpret_cast<const sockaddr&>(storage);
}

}  // namespace

RouteTable::RouteTable(std::vector<std::string> cellularInterfaces, std::string sysClassNet,
                       std::string resolverFile)
    : cellularInterfaces_(std::move(cellularInterfaces)),
      sysClassNet_(std::move(sysClassNet)),
      resolverFile_(std::move(resolverFile)) {}

std::optional<int> RouteTable::lookUp(const sockaddr& address, int through, sockaddr_storage* source) {
  if (address.sa_family != AF_INET && address.sa_family != AF_INET6) return 0;
  if (socket_.get() < 0) socket_ = ownDescriptor(socket(AF_NETLINK, SOCK_RAW | SOCK_CLOEXEC, NETLINK_ROUTE));
  if (socket_.get() < 0) return 0;

  RouteQuestion question{};
  question.header.nlmsg_len = NLMSG_LENGTH(sizeof(rtmsg));
  question.header.nlmsg_type = RTM_GETROUTE;
  question.header.nlmsg_flags = NLM_F_REQUEST;
  question.header.nlmsg_seq = ++sequence_;
  question.route.rtm_family = static_cast<unsigned char>(address.sa_family);
  if (address.sa_family == AF_INET) {
    question.route.rtm_dst_len = 32;
    question.add(RTA_DST, &reinterpret_cast<const sockaddr_in&>(address).sin_addr, 4);
  } else {
    const auto& six = reinterpret_cast<const sockaddr_in6&>(address);
    question.route.rtm_dst_len = 128;
    question.add(RTA_DST, &six.sin6_addr, 16);
    if (through == 0) through = static_cast<int>(six.sin6_scope_id);
  }
  if (through != 0) {
    // Asked for an interface without a route to the address, IPv4 takes the address for a neighbour there.
    // Only an entry of the table counts.
    question.route.rtm_flags = RTM_F_FIB_MATCH;
    question.add(RTA_OIF, &through, sizeof through);
  }
  if (send(socket_.get(), &question, question.header.nlmsg_len, 0) < 0) return 0;

  alignas(nlmsghdr) char answer[4096];
  for (;;) {
    const ssize_t size = recv(socket_.get(), answer, sizeof answer, 0);
    if (size < 0) {
      if (errno == EINTR) continue;
      return 0;
    }
    const auto* header = reinterpret_cast<const nlmsghdr*>(answer);
    if (NLMSG_OK(header, static_cast<unsigned>(size)) && header->nlmsg_seq == sequence_)
      return usableInterface(header, source);
  }
}

std::optional<int> RouteTable::usableRoute(const sockaddr& address, int through, sockaddr_storage* source) {
  const std::optional<int> interface = lookUp(address, through, source);
  return interface && hasCarrier(*interface) ? interface : std::nullopt;
}

bool RouteTable::hasCarrier(int interface) {
  if (flagsSocket_.get() < 0) flagsSocket_ = ownDescriptor(socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  ifreq question{};
  const std::string name = nameOf(interface);
  name.copy(question.ifr_name, sizeof question.ifr_name - 1);
  if (name.empty() || ioctl(flagsSocket_.get(), SIOCGIFFLAGS, &question) != 0) return true;
  return (question.ifr_flags & IFF_RUNNING) != 0;
}

bool RouteTable::isReachable(const sockaddr& address, bool avoidCellular) {
  if (avoidCellular) return interfaceAvoidingCellular(address).has_value();
  return usableRoute(address, 0).has_value();
}

std::optional<std::string> RouteTable::interfaceAvoidingCellular(const sockaddr& address) {
  const std::optional<int> preferred = usableRoute(address, 0);
  if (!preferred) return std::nullopt;
  std::string name = nameOf(*preferred);
  if (!isCellular(name)) return name;
  const std::unique_ptr<struct if_nameindex, decltype(&if_freenameindex)> all(if_nameindex(),
                                                                              if_freenameindex);
  if (!all) return std::nullopt;
  for (const struct if_nameindex* one = all.get(); one->if_index != 0; ++one) {
    if (isCellular(one->if_name)) continue;
    const auto index = static_cast<int>(one->if_index);
    if (usableRoute(address, index).has_value()) return one->if_name;
  }
  return std::nullopt;
}

RouteTable::Way RouteTable::wayOf(const sockaddr& local, const sockaddr& peer, const std::string& interface,
                                  bool avoidCellular) {
  if (avoidCellular) {
    const std::optional<std::string> found = interfaceAvoidingCellular(peer);
    if (!found) return Way::none;
    return found->empty() || interface.empty() || *found == interface ? Way::same : Way::other;
  }
  sockaddr_storage source{};
  if (!usableRoute(peer, 0, &source)) return Way::none;
  return source.ss_family == AF_UNSPEC || sameAddress(local, source) ? Way::same : Way::other;
}

bool RouteTable::isCellular(const std::string& interface) const {
  if (interface.empty()) return false;
  for (const std::string& pattern : cellularInterfaces_)
    if (fnmatch(pattern.c_str(), interface.c_str(), 0) == 0) return true;
  std::ifstream description(sysClassNet_ + "/" + interface + "/uevent");
  for (std::string line; std::getline(description, line);)
    if (line == "DEVTYPE=wwan") return true;
  return false;
}

bool RouteTable::hasDefaultRoute() {
  // Addresses that no network uses, so that only a default route leads to them.
  return usableRoute(generic(parseAddress(AF_INET, "192.0.2.1")), 0).has_value() ||
         usableRoute(generic(parseAddress(AF_INET6, "2001:db8::1")), 0).has_value();
}

bool RouteTable::canResolve() {
  bool named = false;
  std::ifstream file(resolverFile_);
  for (std::string line; std::getline(file, line);) {
    if (!line.starts_with("nameserver")) continue;
    const size_t first = line.find_first_not_of(" \t", 10);
    if (first == std::string::npos) continue;
    const std::string text = line.substr(first, line.find_first_of(" \t%#;", first) - first);
    sockaddr_storage address = parseAddress(AF_INET, text.c_str());
    if (address.ss_family == AF_UNSPEC) address = parseAddress(AF_INET6, text.c_str());
    if (address.ss_family == AF_UNSPEC) continue;
    named = true;
    const bool local = text.starts_with("127.") || text == "::1";
    if (local ? hasDefaultRoute() : usableRoute(generic(address), 0).has_value()) return true;
  }
  return !named && hasDefaultRoute();
}

}  // namespace kyt
