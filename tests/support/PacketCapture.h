// What passes the interfaces of a network namespace, seen from outside the programs that use it: every Internet packet,
// sent or received, on every interface. Needs root, as the namespace does.
#pragma once

#include <set>
#include <string>

#include "tests/support/NetworkNamespace.h"

namespace kyt {

class PacketCapture {
 public:
  // From here on. Throws when it cannot.
  explicit PacketCapture(const NetworkNamespace& space);
  ~PacketCapture();
  PacketCapture(const PacketCapture&) = delete;
  PacketCapture& operator=(const PacketCapture&) = delete;

  // The addresses at the other end of all packets so far, sent and received. Throws when the kernel could not keep
  // them all: what was lost might have been what the caller looks for.
  [[nodiscard]] const std::set<std::string>& peers();

 private:
  int socket_;
  std::set<std::string> peers_;
};

}  // namespace kyt
