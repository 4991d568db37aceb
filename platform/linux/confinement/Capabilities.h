// The capabilities of the process, to give up those it can do without: the daemon before it confines itself, and
// each of the small processes that it forks before. Nothing here allocates or takes a lock, so a forked process may
// use all of it.
#pragma once

#include <cstdint>

namespace kyt {

// A set of capabilities by their numbers.
using CapabilitySet = uint64_t;
[[nodiscard]] constexpr CapabilitySet capabilitySet(int capability) {
  return CapabilitySet{1} << capability;
}

// What the calling thread may use now; nothing when the system does not tell.
[[nodiscard]] CapabilitySet effectiveCapabilities();

// Leaves the calling thread, and those it starts later, at most these capabilities, for good: the others leave the
// permitted and the effective set, all leave the inheritable and the ambient set, and all leave the bounding set when
// that is allowed (CAP_SETPCAP), so that no program started from here gains any. 0 or errno; then nothing is
// certain.
[[nodiscard]] int keepCapabilities(CapabilitySet kept);

// The same for the daemon itself, which keeps none. Run by root, which its service does not do, it keeps what lets
// root read and write files of other users: a root below somebody's home folder, user defaults of their owner.
[[nodiscard]] int giveUpCapabilities();

}  // namespace kyt
