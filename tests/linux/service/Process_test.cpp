// What the daemon asks of its own process.
#include "platform/linux/service/Process.h"

#include <gtest/gtest.h>
#include <malloc.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <latch>
#include <memory>
#include <string>
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

size_t heaps() {
  char* text = nullptr;
  size_t size = 0;
  FILE* const file = ::open_memstream(&text, &size);
  EXPECT_EQ(::malloc_info(0, file), 0);
  std::fclose(file);
  const std::string report(text, size);
  std::free(text);
  size_t count = 0;
  for (size_t at = 0; (at = report.find("<heap nr=", at)) != report.npos; ++at) ++count;
  return count;
}

TEST(Process, HasFourHeapsHoweverManyThreadsUseMemory) {
  if (kSanitized) GTEST_SKIP() << "the sanitizer has an allocator of its own";
  shareHeaps();
  std::latch started(16), counted(1);
  std::vector<std::thread> threads;
  for (int i = 0; i < 16; ++i)
    threads.emplace_back([&] {
      const std::unique_ptr<char[]> block(new char[100]);
      started.count_down();
      counted.wait();
    });
  started.wait();
  EXPECT_GT(heaps(), 1U);
  EXPECT_LE(heaps(), 4U);
  counted.count_down();
  for (std::thread& thread : threads) thread.join();
}

}  // namespace
}  // namespace kyt
