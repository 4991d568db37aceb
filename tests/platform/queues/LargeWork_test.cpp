#include "platform/queues/LargeWork.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <memory>
#include <mutex>
#include <thread>
#include <vector>

#include "platform/queues/SerialQueue.h"
#include "platform/queues/WorkerPool.h"
#include "tests/support/Eventually.h"

namespace kyt {
namespace {

TEST(LargeWork, GoesOnInAsManyThreadsAsItIsToldAndNoMore) {
  LargeWork work(3);
  std::atomic<unsigned> inside{0}, most{0}, done{0};
  {
    std::vector<std::jthread> threads;
    for (int i = 0; i < 8; ++i)
      threads.emplace_back([&] {
        for (int round = 0; round < 300; ++round) {
          const LargeWork::Scope scope(work);
          const unsigned now = ++inside;
          for (unsigned seen = most; seen < now && !most.compare_exchange_weak(seen, now);) continue;
          // The first ones stay until three are there.
          if (round == 0) {
            EXPECT_TRUE(eventually([&] { return most >= 3; }));
          }
          --inside;
          ++done;
        }
      });
  }
  EXPECT_EQ(most, 3u);
  EXPECT_EQ(done, 8u * 300u);
}

TEST(LargeWork, TwoPlacesThatComeFreeAtOnceAreBothTaken) {
  for (int round = 0; round < 200; ++round) {
    LargeWork work(2);
    auto first = std::make_unique<LargeWork::Scope>(work), second = std::make_unique<LargeWork::Scope>(work);
    std::atomic<int> inside{0}, waiting{0};
    std::vector<std::jthread> threads;
    for (int i = 0; i < 2; ++i)
      threads.emplace_back([&] {
        ++waiting;
        const LargeWork::Scope scope(work);
        ++inside;
        EXPECT_TRUE(eventually([&] { return inside == 2; })) << "one place stays empty though somebody waits";
      });
    ASSERT_TRUE(eventually([&] { return waiting == 2; }));
    first.reset();
    second.reset();
  }
}

// However many batches of one user stand in line, another's is next.
TEST(LargeWork, UsersTakeTurns) {
  LargeWork work(1);
  WorkerPool pool(WorkerPoolOptions{});
  std::mutex mutex;
  std::vector<uint64_t> order;
  auto held = std::make_unique<LargeWork::Scope>(work);
  const auto wants = [&](uint64_t owner) {
    SerialQueue::create("test.large", pool, owner)->async([&, owner] {
      const LargeWork::Scope scope(work);
      const std::lock_guard lock(mutex);
      order.push_back(owner);
    });
  };
  for (int i = 0; i < 6; ++i) wants(1000);
  EXPECT_TRUE(eventually([&] { return pool.figures().blocked == 6; }));
  wants(2000);
  EXPECT_TRUE(eventually([&] { return pool.figures().blocked == 7; }));
  held.reset();
  EXPECT_TRUE(eventually([&] {
    const std::lock_guard lock(mutex);
    return order.size() == 7;
  }));
  pool.shutDown();
  const auto place = std::find(order.begin(), order.end(), 2000u) - order.begin();
  EXPECT_LE(place, 1);
}

}  // namespace
}  // namespace kyt
