// What the allocator and the system say of this process's memory. Any thread.
#pragma once

#include <cstddef>
#include <cstdint>

namespace kyt {

class MemoryInfo {
 public:
  virtual ~MemoryInfo() = default;
  // The allocator's size of a heap block; 0 for null.
  [[nodiscard]] virtual size_t blockSize(const void* block) = 0;
  // The process's anonymous memory in bytes; 0 when the query fails.
  [[nodiscard]] virtual uint64_t internalMemory() = 0;
};

}  // namespace kyt
