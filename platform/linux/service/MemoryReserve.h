// What happens when the system refuses memory: the daemon ends, as orderly as it can. Some address space is kept back for
// that; the first refusal gives it up, says so on standard error, and asks for the end, and then what was asked for is
// tried again. Each thread tries again once; when even that is used up the process ends at once, with a line and status
// 1.
//
// It concerns what C++ code allocates, with operator new or as objects do (platform/base/Allocation.h). Libraries in C get
// a null pointer, and report an error.
#pragma once

#include <atomic>
#include <cstddef>

#include "platform/linux/base/StopSignals.h"

namespace kyt {

// At most one at a time: the handler that it sets is the process's. Made by the main thread, outlives the others.
class MemoryReserve {
 public:
  static constexpr size_t kBytes = size_t{32} << 20;  // of addresses; none of it is touched

  explicit MemoryReserve(StopSignals& stopSignals);
  ~MemoryReserve();
  MemoryReserve(const MemoryReserve&) = delete;
  MemoryReserve& operator=(const MemoryReserve&) = delete;
  // Whether memory was refused. Any thread.
  [[nodiscard]] bool isUsed() const { return used_.load(); }

 private:
  static void refused();
  void use();

  StopSignals& stopSignals_;
  std::atomic<void*> block_;
  std::atomic<bool> used_{false};
};

}  // namespace kyt
