#include "platform/queues/Gate.h"

#include <gtest/gtest.h>

#include <atomic>
#include <memory>
#include <thread>
#include <vector>

#include "platform/queues/SerialQueue.h"
#include "platform/queues/WorkerPool.h"
#include "tests/support/Eventually.h"

namespace kyt {
namespace {

TEST(Gate, LetsOneThreadInAtATime) {
  Gate gate;
  int inside = 0, entered = 0;
  {
    std::vector<std::jthread> threads;
    for (int i = 0; i < 4; ++i)
      threads.emplace_back([&] {
        for (int round = 0; round < 1000; ++round) {
          const GateLock lock(gate);
          EXPECT_EQ(++inside, 1);
          ++entered;
          --inside;
        }
      });
  }
  EXPECT_EQ(entered, 4000);
}

TEST(Gate, WhoWaitsAtItIsCountedAsBlocked) {
  Gate gate;
  WorkerPoolOptions options;
  options.runnable = 1;
  WorkerPool pool(options);
  const auto waits = SerialQueue::create("test.waits", pool), other = SerialQueue::create("test.other", pool);
  std::atomic<bool> entered{false}, ran{false};
  gate.enter();
  waits->async([&] {
    const GateLock lock(gate);
    entered = true;
  });
  other->async([&] { ran = true; });
  EXPECT_TRUE(eventually([&] { return ran.load(); })) << "on another worker";
  EXPECT_FALSE(entered);
  EXPECT_TRUE(eventually([&] { return pool.figures().blocked == 1; }));
  gate.leave();
  EXPECT_TRUE(eventually([&] { return entered.load(); }));
  pool.shutDown();
}

}  // namespace
}  // namespace kyt
