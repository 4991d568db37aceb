// Who may connect: what a connection's peer is, and the entitlements that its user, group, executable or
// security label were granted. The IPC server asks on each new connection's behalf, before a byte is
// exchanged; the real one reads entitlements.d (platform/linux/).
//
// Any thread, one call at a time for one PeerCredentials. May read small files; never waits for anything
// else.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "platform/base/Descriptor.h"
#include "platform/objects/Value.h"

namespace kyt {

// What the kernel says about the other end of a connection, as of the moment it connected.
struct PeerCredentials {
  int32_t pid = 0;
  uint32_t uid = 0;
  uint32_t gid = 0;
  std::vector<uint32_t> groups;  // supplementary; without gid
  std::string securityLabel;     // empty when the system has none
  // Refers to the process that connected, not to whoever has its number now; empty where the kernel cannot
  // give it.
  Descriptor pidfd;
};

class Entitlements {
 public:
  virtual ~Entitlements() = default;
  // The value that a matching grant holds under the key; null when none does. Any matching grant suffices.
  [[nodiscard]] virtual Value valueFor(const PeerCredentials& peer, std::string_view key) = 0;
  // The path of the program that the peer runs, for a line in the log; empty where that is not known.
  [[nodiscard]] virtual std::string executableOf(const PeerCredentials& /*peer*/) { return {}; }
};

}  // namespace kyt
