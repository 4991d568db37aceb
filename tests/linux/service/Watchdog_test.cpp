// Signs of life: as often as was asked for, and none from a daemon that hangs.
#include "platform/linux/service/Watchdog.h"

#include <gtest/gtest.h>
#include <stdlib.h>
#include <unistd.h>

#include <atomic>
#include <memory>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "platform/fake/ManualClock.h"
#include "platform/fake/ManualExecutor.h"
#include "platform/fake/ManualTimers.h"
#include "platform/linux/base/EpollReactor.h"
#include "platform/queues/SerialQueue.h"
#include "platform/queues/WorkerPool.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/Eventually.h"

namespace kyt {
namespace {

using namespace std::chrono_literals;

using Variables = std::vector<std::pair<const char*, std::string>>;

// In microseconds; "none".
std::string requestedWith(const Variables& variables) {
  return inChildProcess([&]() -> std::string {
    for (const char* name : {"NOTIFY_SOCKET", "WATCHDOG_USEC", "WATCHDOG_PID"}) ::unsetenv(name);
    for (const auto& [name, value] : variables)
      ::setenv(name, value == "own" ? std::to_string(::getpid()).c_str() : value.c_str(), 1);
    const auto interval = Watchdog::requestedInterval();
    if (!interval) return "none";
    return std::to_string(std::chrono::duration_cast<std::chrono::microseconds>(*interval).count());
  });
}

TEST(Watchdog, IsWantedWhenTheServiceManagerAsksThisProcess) {
  EXPECT_EQ(requestedWith({{"NOTIFY_SOCKET", "/s"}, {"WATCHDOG_USEC", "30000000"}}), "30000000");
  EXPECT_EQ(requestedWith({{"NOTIFY_SOCKET", "/s"}, {"WATCHDOG_USEC", "1"}, {"WATCHDOG_PID", "own"}}), "1");
  EXPECT_EQ(requestedWith({{"NOTIFY_SOCKET", "/s"}, {"WATCHDOG_USEC", "18446744073709551615"}}),
            "31536000000000");
}

TEST(Watchdog, IsNotWantedOtherwise) {
  EXPECT_EQ(requestedWith({}), "none");
  EXPECT_EQ(requestedWith({{"NOTIFY_SOCKET", "/s"}}), "none");
  EXPECT_EQ(requestedWith({{"WATCHDOG_USEC", "30000000"}}), "none");
  for (const char* number : {"", "0", "-1", "1s", " 1", "18446744073709551616"})
    EXPECT_EQ(requestedWith({{"NOTIFY_SOCKET", "/s"}, {"WATCHDOG_USEC", number}}), "none") << number;
  for (const char* process : {"", "1", "own "})
    EXPECT_EQ(requestedWith({{"NOTIFY_SOCKET", "/s"}, {"WATCHDOG_USEC", "1"}, {"WATCHDOG_PID", process}}),
              "none")
        << process;
}

class WatchdogSigns : public testing::Test {
 protected:
  void run(Duration time) {
    timers_.advance(time, [this] { executor_.runAll(); });
  }
  ManualClock clock_;
  ManualTimers timers_{clock_};
  ManualExecutor executor_;
  int signs_ = 0;
  Watchdog watchdog_{10s, timers_, executor_, [this] { ++signs_; }};
};

TEST_F(WatchdogSigns, LeaveTwiceInEachInterval) {
  run(4999ms);
  EXPECT_EQ(signs_, 0);
  run(1ms);
  EXPECT_EQ(signs_, 1);
  run(55s);
  EXPECT_EQ(signs_, 12);
}

TEST_F(WatchdogSigns, DoNotLeaveWithoutTheReactor) {
  run(5s);
  executor_.runAll();  // the workers go on
  EXPECT_EQ(signs_, 1);
}

TEST_F(WatchdogSigns, DoNotLeaveWithoutAWorkerAndDoNotPileUp) {
  timers_.advance(100s);
  EXPECT_EQ(signs_, 0);
  EXPECT_EQ(executor_.pending(), 1U);
  executor_.runAll();
  EXPECT_EQ(signs_, 1) << "it is alive now, and was not before";
  run(5s);
  EXPECT_EQ(signs_, 2);
}

TEST(WatchdogOfAPool, IsSilentWhileEveryWorkerHangs) {
  auto reactor = EpollReactor::create();
  ASSERT_NE(reactor, nullptr);
  WorkerPoolOptions options;
  options.runnable = options.maxWorkers = 2;
  WorkerPool pool(options);
  std::atomic<int> hanging{0}, ticks{0}, signs{0};
  std::atomic<bool> mayEnd{false};
  std::vector<std::shared_ptr<SerialQueue>> queues;
  for (int i = 0; i < 2; ++i) {
    queues.push_back(SerialQueue::create("hangs", pool));
    queues.back()->async([&] {
      ++hanging;
      while (!mayEnd) std::this_thread::yield();
    });
  }
  ASSERT_TRUE(eventually([&] { return hanging == 2; }));
  {
    // Another pool's short work has the reactor run queues itself, as it does in a busy daemon.
    WorkerPool busy{WorkerPoolOptions{}};
    const auto queue = SerialQueue::create("ticks", busy);
    const TimerHandle ticking = reactor->every(1ms, 0ms, queue, [&] { ++ticks; });
    const Watchdog watchdog(2ms, *reactor, pool, [&] { ++signs; });
    EXPECT_TRUE(eventually([&] { return ticks >= 100; }));
    EXPECT_EQ(signs, 0);
    mayEnd = true;
    EXPECT_TRUE(eventually([&] { return signs >= 3; }));
    reactor->stop();
    pool.shutDown();
    busy.shutDown();
  }
}

// The reactor runs short work of a busy daemon itself, on a thread that says nothing about the workers.
TEST(WatchdogOfAPool, IsNotServedByTheReactor) {
  auto reactor = EpollReactor::create();
  ASSERT_NE(reactor, nullptr);
  static thread_local bool isWorker = false;
  WorkerPoolOptions options;
  options.nameThread = [](const char*) { isWorker = true; };
  WorkerPool workers(options);
  const auto queue = SerialQueue::create("ticks", workers);
  std::atomic<int> ticksOfReactor{0}, signsOfReactor{0}, signsOfWorkers{0};
  {
    const TimerHandle ticking = reactor->every(1ms, 0ms, queue, [&] { ticksOfReactor += isWorker ? 0 : 1; });
    const Watchdog watchdog(2ms, *reactor, workers, [&] { ++(isWorker ? signsOfWorkers : signsOfReactor); });
    EXPECT_TRUE(eventually([&] { return ticksOfReactor >= 50 && signsOfWorkers >= 50; }))
        << ticksOfReactor << " " << signsOfWorkers;
    reactor->stop();
    workers.shutDown();
  }
  EXPECT_EQ(signsOfReactor, 0);
}

}  // namespace
}  // namespace kyt
