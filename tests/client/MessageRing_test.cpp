#include "client/MessageRing.h"

#include <gtest/gtest.h>

#include <memory>
#include <thread>
#include <vector>

namespace kyt::client {
namespace {

TEST(MessageRing, KeepsTheOrderOfOneProducer) {
  MessageRing<std::unique_ptr<int>> ring(8);
  for (int i = 0; i < 8; ++i) EXPECT_TRUE(ring.push(std::make_unique<int>(i)));
  for (int i = 0; i < 8; ++i) {
    std::unique_ptr<int> item;
    ASSERT_TRUE(ring.pop(item));
    EXPECT_EQ(*item, i);
  }
  EXPECT_TRUE(ring.empty());
}

TEST(MessageRing, RefusesWhatDoesNotFitAndLeavesItWithTheCaller) {
  MessageRing<std::unique_ptr<int>> ring(4);
  for (int i = 0; i < 4; ++i) EXPECT_TRUE(ring.push(std::make_unique<int>(i)));
  auto fifth = std::make_unique<int>(5);
  EXPECT_FALSE(ring.push(std::move(fifth)));
  ASSERT_NE(fifth, nullptr);
  EXPECT_EQ(ring.size(), 4u);
}

TEST(MessageRing, LosesAndRepeatsNothingUnderManyProducers) {
  MessageRing<int> ring(64);
  constexpr int kProducers = 4, kEach = 20000;
  std::vector<std::thread> producers;
  for (int p = 0; p < kProducers; ++p)
    producers.emplace_back([&ring, p] {
      for (int i = 0; i < kEach; ++i)
        while (!ring.push(p * kEach + i)) std::this_thread::yield();
    });
  std::vector<int> last(kProducers, -1);
  for (int got = 0; got < kProducers * kEach;) {
    int item = 0;
    if (!ring.pop(item)) {
      std::this_thread::yield();
      continue;
    }
    ++got;
    const auto producer = static_cast<size_t>(item / kEach);
    ASSERT_LT(last[producer], item % kEach);
    last[producer] = item % kEach;
  }
  for (std::thread& producer : producers) producer.join();
  for (const int value : last) EXPECT_EQ(value, kEach - 1);
}

}  // namespace
}  // namespace kyt::client
