#include "platform/objects/ObjectSize.h"

#include <gtest/gtest.h>

#include <map>

#include "platform/objects/MemoryInfo.h"

namespace kyt {
namespace {

// Blocks have the sizes that the test gives them.
class ListedMemory : public MemoryInfo {
 public:
  size_t blockSize(const void* block) override { return block == nullptr ? 0 : sizes.at(block); }
  uint64_t internalMemory() override { return 0; }
  std::map<const void*, size_t> sizes;
};

TEST(ObjectSize, CountsNothingForWhatOwnsNoBlock) {
  ListedMemory memory;
  EXPECT_EQ(objectSizeEstimate(Value(1), memory), 0U);
  EXPECT_EQ(objectSizeEstimate(Value("short"), memory), 0U);
  EXPECT_EQ(objectSizeEstimate(Value(), memory), 0U);
  EXPECT_EQ(objectSizeEstimate(Dictionary(), memory), 0U);
}

TEST(ObjectSize, CountsEveryValueOfAContainerTwiceAndKeysOnce) {
  const Value text("a text of more than fifteen bytes");
  const Value list(Array{text, 1});
  const String key("a key of more than fifteen bytes");
  const Dictionary dictionary{{key, text}, {"list", list}};
  ListedMemory memory;
  memory.sizes = {{text.block(), 10}, {list.block(), 100}, {key.block(), 1000}, {dictionary.block(), 10000}};
  EXPECT_EQ(objectSizeEstimate(text, memory), 10U);
  EXPECT_EQ(objectSizeEstimate(list, memory), 120U);
  EXPECT_EQ(objectSizeEstimate(dictionary, memory), 10000U + 1000 + 20 + 220);
  EXPECT_EQ(objectSizeEstimate(Value(dictionary), memory), 10000U + 1000 + 20 + 220);
}

TEST(ObjectSize, CountsTheIndexOfALargeDictionary) {
  Dictionary dictionary;
  for (int i = 0; i < 40; ++i) dictionary.set(std::to_string(i), i);
  ListedMemory memory;
  memory.sizes = {{dictionary.block(), 7}, {dictionary.indexBlock(), 30}};
  EXPECT_EQ(objectSizeEstimate(dictionary, memory), 37U);
}

TEST(ObjectSize, WrapsAtThirtyTwoBits) {
  const Value text("a text of more than fifteen bytes");
  ListedMemory memory;
  memory.sizes = {{text.block(), 0x1'0000'0005}};
  EXPECT_EQ(objectSizeEstimate(text, memory), 5U);
}

}  // namespace
}  // namespace kyt
