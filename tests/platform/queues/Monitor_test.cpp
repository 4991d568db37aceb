// The monitor: who gets it, in which order, and what the worker pool lets its waiters hold.
#include "platform/queues/Monitor.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "platform/base/Semaphore.h"
#include "platform/queues/SerialQueue.h"
#include "platform/queues/WorkerPool.h"
#include "tests/support/Eventually.h"
#include "tests/support/Sanitizers.h"

namespace kyt {
namespace {

using namespace std::chrono_literals;

WorkerPoolOptions options(size_t runnable, size_t most = 512) {
  WorkerPoolOptions result;
  result.runnable = runnable;
  result.maxWorkers = most;
  return result;
}

void takeTwice(Monitor& monitor) NO_THREAD_SAFETY_ANALYSIS {
  monitor.lock();
  monitor.lock();
  monitor.unlock();
}

void giveBack(Monitor& monitor) NO_THREAD_SAFETY_ANALYSIS {
  monitor.unlock();
}

TEST(Monitor, IsFreeWhenItsHolderHasGivenItBackAsOftenAsItTookIt) {
  Monitor monitor;
  takeTwice(monitor);
  std::atomic<bool> taken{false}, waits{false};
  std::thread other([&] {
    waits = true;
    const MonitorLock lock(monitor);
    taken = true;
  });
  EXPECT_TRUE(eventually([&] { return waits.load(); }));
  EXPECT_FALSE(taken);
  giveBack(monitor);
  other.join();
  EXPECT_TRUE(taken);
}

TEST(Monitor, LetsOneThreadInAtATime) {
  Monitor monitor;
  int inside = 0, entered = 0;
  {
    std::vector<std::jthread> threads;
    for (int i = 0; i < 8; ++i)
      threads.emplace_back([&] {
        for (int round = 0; round < 2000; ++round) {
          takeTwice(monitor);
          EXPECT_EQ(++inside, 1);
          ++entered;
          --inside;
          giveBack(monitor);
        }
      });
  }
  EXPECT_EQ(entered, 16000);
}

// Many queues that each take the monitor once.
class Crowd {
 public:
  Crowd(WorkerPool& pool, Monitor& monitor) : pool_(pool), monitor_(monitor) {}
  void add(uint64_t owner, char name, int count = 1) {
    for (int i = 0; i < count; ++i) {
      queues_.push_back(SerialQueue::create("test", pool_, owner));
      queues_.back()->async([this, name] {
        const MonitorLock lock(monitor_);
        order_ += name;
        ++taken_;
      });
    }
  }
  [[nodiscard]] bool isThrough() const { return taken_ == queues_.size(); }
  [[nodiscard]] const std::string& order() const { return order_; }

 private:
  WorkerPool& pool_;
  Monitor& monitor_;
  std::vector<std::shared_ptr<SerialQueue>> queues_;
  std::string order_;
  std::atomic<size_t> taken_{0};
};

TEST(WorkerPool, KeepsOthersRunningWhileAMonitorIsHeld) {
  WorkerPool pool(options(1));
  Monitor monitor;
  Crowd crowd(pool, monitor);
  auto other = SerialQueue::create("other", pool);
  Semaphore ran;
  {
    const MonitorLock lock(monitor);
    crowd.add(0, 'a');
    EXPECT_TRUE(eventually([&] { return pool.figures().blocked == 1; }));
    other->async([&] { ran.signal(); });
    EXPECT_TRUE(ran.waitFor(kTestDeadline));
  }
  EXPECT_TRUE(eventually([&] { return crowd.isThrough(); }));
  pool.shutDown();
}

TEST(Monitor, LetsUsersTakeTurnsHoweverManyThreadsOfOneWait) {
  WorkerPool pool(options(1));
  Monitor monitor;
  Crowd crowd(pool, monitor);
  {
    const MonitorLock lock(monitor);
    crowd.add(1001, 'a', 30);
    EXPECT_TRUE(eventually([&] { return pool.figures().blocked == 30; }));
    crowd.add(1002, 'b', 30);
    EXPECT_TRUE(eventually([&] { return pool.figures().blocked == 60; }));
    crowd.add(1003, 'X');
    EXPECT_TRUE(eventually([&] { return pool.figures().blocked == 61; }));
  }
  EXPECT_TRUE(eventually([&] { return crowd.isThrough(); }));
  pool.shutDown();
  EXPECT_EQ(crowd.order().substr(0, 3), "abX");
}

TEST(Monitor, LetsThreadsOfOneUserInInTheOrderOfTheirArrival) {
  WorkerPool pool(options(1));
  Monitor monitor;
  Crowd crowd(pool, monitor);
  {
    const MonitorLock lock(monitor);
    for (size_t i = 0; i < 20; ++i) {
      crowd.add(1001, static_cast<char>('a' + i));
      EXPECT_TRUE(eventually([&] { return pool.figures().blocked == i + 1; }));
    }
  }
  EXPECT_TRUE(eventually([&] { return crowd.isThrough(); }));
  pool.shutDown();
  EXPECT_EQ(crowd.order(), "abcdefghijklmnopqrst");
}

// Threads that give the monitor back and take it again at once are always quicker than one that must wake first.
TEST(Monitor, IsPassedToAnotherUserWhereThreadsOfOneTakeItAgainAndAgain) {
  constexpr int kThreads = 8, kRounds = 20;
  WorkerPool pool(options(kThreads + 1));
  Monitor monitor;
  std::atomic<int> holds{0}, left{kThreads};
  std::atomic<bool> stop{false};
  std::vector<std::shared_ptr<SerialQueue>> greedy;
  for (int i = 0; i < kThreads; ++i) {
    greedy.push_back(SerialQueue::create("greedy", pool, 1001));
    greedy.back()->async([&] {
      while (!stop) {
        const MonitorLock lock(monitor);
        ++holds;
        const auto end = std::chrono::steady_clock::now() + 2ms;
        while (std::chrono::steady_clock::now() < end) {
        }
      }
      --left;
    });
  }
  EXPECT_TRUE(eventually([&] { return pool.figures().blocked == kThreads - 1; }));
  int holdsWhileWaiting = 0;
  const auto victim = SerialQueue::create("victim", pool, 5000);
  for (int round = 0; round < kRounds; ++round) {
    Semaphore had;
    victim->async([&] {
      const int before = holds;
      const MonitorLock lock(monitor);
      holdsWhileWaiting += holds - before;
      had.signal();
    });
    ASSERT_TRUE(had.waitFor(kTestDeadline));
  }
  stop = true;
  EXPECT_TRUE(eventually([&] { return left == 0; }));
  pool.shutDown();
  EXPECT_LE(holdsWhileWaiting, 3 * kRounds) << "in a line with the others it would be " << kThreads * kRounds;
}

TEST(Monitor, WaitersOfAFewUsersLeaveWorkersToAnother) {
  if (kSanitized) GTEST_SKIP() << "hundreds of threads";
  WorkerPool pool(options(2));
  Monitor monitor;
  Crowd crowd(pool, monitor);
  Semaphore ran;
  const auto victim = SerialQueue::create("victim", pool, 5000);
  {
    const MonitorLock lock(monitor);
    size_t before = 0;
    for (uint64_t user = 1; user <= 4; ++user) {
      crowd.add(1000 + user, 'a', 300);
      // Those that were about to wait when the limit was reached are few.
      const size_t share = (512 - before) / 5;
      EXPECT_TRUE(eventually([&] { return pool.figures().blocked >= before + share; }));
      victim->async([&] { ran.signal(); });
      ASSERT_TRUE(ran.waitFor(kTestDeadline)) << user << " users";
      EXPECT_LE(pool.figures().blocked, before + share + 8) << user << " users";
      before = pool.figures().blocked;
    }
  }
  EXPECT_TRUE(eventually([&] { return crowd.isThrough(); }));
  pool.shutDown();
}

// By whatever they wait for.
TEST(WorkerPool, BlockedWorkersOfSeveralOwnersLeaveSomeToAnother) {
  WorkerPool pool(options(2, 32));
  Semaphore release, ran;
  std::vector<std::shared_ptr<SerialQueue>> queues;
  std::atomic<size_t> done{0};
  const auto add = [&](uint64_t owner) {
    for (int i = 0; i < 40; ++i) {
      queues.push_back(SerialQueue::create("blocked", pool, owner));
      queues.back()->async([&] {
        release.wait();
        ++done;
      });
    }
  };
  const auto victim = SerialQueue::create("victim", pool, 5000);
  for (const auto& [owner, blocked] : {std::pair{1001, 16U}, {1002, 24U}, {1003, 28U}, {1004, 30U}}) {
    add(static_cast<uint64_t>(owner));
    EXPECT_TRUE(eventually([&, most = blocked] { return pool.figures().blocked == most; })) << owner;
    victim->async([&] { ran.signal(); });
    ASSERT_TRUE(ran.waitFor(kTestDeadline)) << owner;
  }
  for (size_t i = 0; i < queues.size(); ++i) release.signal();
  EXPECT_TRUE(eventually([&] { return done == queues.size(); })) << "what was kept back runs in the end";
  pool.shutDown();
}

}  // namespace
}  // namespace kyt
