// How the system's earlier runs ended, as far as the journal tells. One thread.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "sources/boots/KernelDumps.h"

namespace kyt::sources {

struct EndedBoot {
  std::string boot;               // its identifier, which never leaves the device
  uint64_t began = 0, ended = 0;  // of its first and last entry, in microseconds since 1970
  // "reboot", "power-off", "halt", "kexec", "shutdown" (in order, the way is not known), "panic" (the kernel's),
  // "watchdog", "unclean" (the power was cut, or it hung: nothing was written).
  std::string reason;
};

// What the machine itself keeps over a start.
struct KeptSigns {
  bool watchdogFired = false;  // the hardware says that it reset the machine, before the current run began
  PanicDumps panics;
};

// Runs other than `current` whose last entry is later than `after` (microseconds since 1970), the oldest first; or why
// the journal in that folder (empty: this machine's) cannot be read.
struct EndedBoots {
  std::vector<EndedBoot> boots;
  std::string problem;
};
[[nodiscard]] EndedBoots endedBoots(const std::string& folder, const std::string& current, uint64_t after,
                                    const KeptSigns& signs);

// How long the start took until the service manager was done, in milliseconds; none: it is not done, or says nothing.
[[nodiscard]] std::optional<uint64_t> startupMilliseconds(const std::string& folder, const std::string& boot);

}  // namespace kyt::sources
