// What the daemon asks of its own process.
#include "platform/linux/service/Process.h"

#include <gtest/gtest.h>

#include <cstring>
#include <memory>
#include <thread>
#include <vector>

#include "platform/linux/data/LinuxMemoryInfo.h"
#include "tests/support/Sanitizers.h"

namespace kyt {
namespace {

constexpr size_t kMiB = 1 << 20;

// Several blocks of several sizes, filled, on a thread of their own, as an upload's worker does.
void useLargeBlocks() {
  std::thread([] {
    std::vector<std::unique_ptr<char[]>> blocks;
    for (const size_t size : {20 * kMiB, 5 * kMiB, 20 * kMiB, 8 * kMiB, 20 * kMiB}) {
      blocks.emplace_back(new char[size]);
      std::memset(blocks.back().get(), 1, size);
      if (blocks.size() == 2) blocks.erase(blocks.begin());
    }
    const std::unique_ptr<char[]> stays(new char[64]);  // above what was freed, if that is a heap's
  }).join();
}

TEST(Process, GivesLargeBlocksBackToTheSystem) {
  if (kSanitized) GTEST_SKIP() << "the sanitizer has an allocator of its own";
  giveLargeBlocksBack();
  useLargeBlocks();
  const uint64_t before = LinuxMemoryInfo().internalMemory();
  for (int i = 0; i < 5; ++i) useLargeBlocks();
  EXPECT_LT(LinuxMemoryInfo().internalMemory(), before + 2 * kMiB);
}

}  // namespace
}  // namespace kyt
