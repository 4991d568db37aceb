#include "platform/linux/data/LinuxMemoryInfo.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>

#include "platform/objects/ObjectSize.h"

namespace kyt {
namespace {

TEST(LinuxMemoryInfo, AsksTheAllocatorForTheSizeOfABlock) {
  LinuxMemoryInfo memory;
  EXPECT_EQ(memory.blockSize(nullptr), 0U);
  void* block = std::malloc(1000);
  EXPECT_GE(memory.blockSize(block), 1000U);
  EXPECT_LT(memory.blockSize(block), 2000U);
  std::free(block);
}

TEST(LinuxMemoryInfo, EstimatesRealObjects) {
  LinuxMemoryInfo memory;
  const Value text(std::string(100, 'x'));
  const uint32_t one = objectSizeEstimate(text, memory);
  EXPECT_EQ(one, memory.blockSize(text.block()));
  EXPECT_GE(one, 101U);
  const Dictionary dictionary{{"a", text}, {"b", text}};
  EXPECT_EQ(objectSizeEstimate(dictionary, memory), 4 * one + memory.blockSize(dictionary.block()));
}

TEST(LinuxMemoryInfo, SeesAnonymousMemoryGrow) {
  LinuxMemoryInfo memory;
  const uint64_t before = memory.internalMemory();
  EXPECT_GT(before, 0U);
  constexpr size_t kSize = size_t{64} << 20;
  char* block = static_cast<char*>(std::malloc(kSize));
  std::memset(block, 1, kSize);
  asm volatile("" : : "r"(block) : "memory");  // the pages are to be touched, whatever the optimiser knows
  EXPECT_GE(memory.internalMemory(), before + kSize * 9 / 10);
  std::free(block);
}

}  // namespace
}  // namespace kyt
