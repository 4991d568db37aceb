// Room in the kernel's table of this process's descriptors, made before it is needed.
//
// The kernel doubles that table when it is full. In a process with threads it then waits for all processors to pass a
// quiet point, some 10 to 20 ms, and so does every thread that wants a descriptor meanwhile. Were that left to happen by
// itself, one client that passes many descriptors would hold up everybody. So the table is large from the start, while
// there is one thread, where growing costs nothing; later it is doubled when it is half full, by one thread that has
// announced the wait, while the others find room. "FDSize" in /proc/self/status is its size.
#pragma once

#include <atomic>

namespace kyt {

class DescriptorRoom {
 public:
  static constexpr int kAtFirst = 4096;  // 8 bytes each, of the kernel's memory

  // Before there are threads.
  DescriptorRoom();
  // Any thread: this descriptor is in use. Mostly one comparison; makes more room when half of it is used up. Waits
  // then, in a BlockingScope. A system that refuses is not asked again until much more is in use.
  void noteUsed(int descriptor) {
    if (descriptor >= half_.load(std::memory_order_relaxed)) grow(descriptor);
  }

 private:
  void grow(int descriptor);

  std::atomic<int> half_{0};
  std::atomic<bool> growing_{false};
};

}  // namespace kyt
