#include "platform/queues/LargeWork.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <memory>
#include <mutex>
#include <thread>
#include <vector>

#include "platform/base/Semaphore.h"
#include "platform/queues/FairLock.h"
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

// Of two places the first is left to whoever takes it, upon which the first in line is woken; the second, when the slice is
// over, is passed to that very one, who has not run yet. Whether it hits the moment is the scheduler's choice: each round
// tries it, and whatever happens both who wait must get a place.
TEST(LargeWork, APlaceIsTakenThoughWhoWasWokenForItIsPassedAnother) {
  constexpr auto kSlice = std::chrono::milliseconds(1);
  for (int round = 0; round < 100; ++round) {
    FairLock lock(2);
    lock.take();
    lock.take();
    std::atomic<int> inside{0};
    WorkerPoolOptions options;
    options.runnable = 4;
    WorkerPool pool(options);
    for (int i = 0; i < 3; ++i)
      SerialQueue::create("test.large", pool)->async([&] {
        lock.take();
        ++inside;
      });
    ASSERT_TRUE(eventually([&] { return pool.figures().blocked == 3; }));
    const auto until = [begin = std::chrono::steady_clock::now()](std::chrono::microseconds time) {
      while (std::chrono::steady_clock::now() - begin < time) continue;
    };
    lock.giveBack();  // passed to the first, whose slice begins
    until(kSlice - std::chrono::microseconds(10));
    lock.giveBack();
    until(kSlice + std::chrono::microseconds(10));
    lock.giveBack();
    // Nobody gives back any more.
    EXPECT_TRUE(eventually([&] { return inside == 3; })) << "a place stays empty though somebody waits";
    if (inside != 3) lock.giveBack();
    pool.shutDown();
  }
}

// It computes: its worker's processor is given to nobody else, so that no more threads want one than there are.
TEST(LargeWork, KeepsItsWorkersPlaceInThePoolAndLeavesOneToSmallWork) {
  WorkerPoolOptions options;
  options.runnable = 3;
  WorkerPool pool(options);
  LargeWork work(2);
  std::atomic<int> inside{0}, small{0};
  std::atomic<bool> goOn{false};
  const auto wantsMuch = [&] {
    SerialQueue::create("test.large", pool, 1000)->async([&] {
      const LargeWork::Scope scope(work);
      ++inside;
      EXPECT_TRUE(eventually([&] { return goOn.load(); }));
      --inside;
    });
  };
  for (int i = 0; i < 4; ++i) wantsMuch();
  EXPECT_TRUE(eventually([&] { return inside == 2 && pool.figures().blocked == 2; }))
      << "two have places, two stand in line: " << pool.figures().blocked;
  // Of the three that may run two compute; those in line are counted out.
  for (int i = 0; i < 20; ++i) SerialQueue::create("test.small", pool, 2000)->async([&] { ++small; });
  EXPECT_TRUE(eventually([&] { return small == 20; }));
  EXPECT_EQ(inside, 2);
  EXPECT_EQ(pool.figures().workers, 5u) << "no worker more than those in line, those inside, and one";
  goOn = true;
  EXPECT_TRUE(eventually([&] { return pool.figures().idle == pool.figures().workers; }));
  pool.shutDown();
}

TEST(LargeWork, LetsOthersRunWhereItWaitsAfterAll) {
  WorkerPoolOptions options;
  options.runnable = 1;
  WorkerPool pool(options);
  LargeWork work(1);
  Semaphore goOn, over;
  std::atomic<bool> wentOn{false};
  SerialQueue::create("test.large", pool)->async([&] {
    const LargeWork::Scope scope(work);
    SerialQueue::create("test.small", pool)->async([&] { goOn.signal(); });
    wentOn = goOn.waitFor(kTestDeadline);
    over.signal();
  });
  over.wait();
  EXPECT_TRUE(wentOn);
  pool.shutDown();
}

TEST(LargeWork, HasOnePlaceLessThanQueuesMayRun) {
  LargeWork work;
  const size_t most = std::max(2u, std::thread::hardware_concurrency()) - 1;
  std::vector<std::unique_ptr<LargeWork::Scope>> all;
  for (size_t i = 0; i < most; ++i) all.push_back(std::make_unique<LargeWork::Scope>(work));
  std::atomic<bool> isIn{false};
  WorkerPool pool(WorkerPoolOptions{});
  SerialQueue::create("test.large", pool)->async([&] {
    const LargeWork::Scope scope(work);
    isIn = true;
  });
  EXPECT_TRUE(eventually([&] { return pool.figures().blocked == 1; })) << "it stands in line";
  EXPECT_FALSE(isIn);
  all.pop_back();
  EXPECT_TRUE(eventually([&] { return isIn.load(); }));
  pool.shutDown();
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
