// What the allocator and the kernel say about this process's memory.
#pragma once

#include "platform/objects/MemoryInfo.h"

namespace kyt {

class LinuxMemoryInfo : public MemoryInfo {
 public:
  [[nodiscard]] size_t blockSize(const void* block) override;
  // RssAnon of /proc/self/status.
  [[nodiscard]] uint64_t internalMemory() override;
};

}  // namespace kyt
