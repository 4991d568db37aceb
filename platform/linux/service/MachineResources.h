// How much memory and how many descriptors there are for the daemon, on which the shares of users depend
// (platform/base/UserBudget.h). Read once, at the start, before the confinement: it hides some of it.
#pragma once

#include <cstdint>
#include <string>

namespace kyt {

struct MachineSources {
  std::string processFolder = "/proc/self";
  std::string controlGroups = "/sys/fs/cgroup";
  uint64_t memory = 0;        // of the machine; 0: asked of the system
  uint64_t addressSpace = 0;  // the limit of the process; 0: asked of the system
};

// Bytes that the daemon may use at most: a quarter of the machine's memory, as its service has it (MemoryMax=), or what
// its control groups allow, or a quarter of the address space, whichever is least.
[[nodiscard]] uint64_t memoryForTheDaemon(const MachineSources& sources = {});

}  // namespace kyt
