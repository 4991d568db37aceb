// What every timer service keeps. A harness gives `service()`, `queue()` (whose work runs by itself or in
// `pass`), `clock()`, and `pass(condition)`, which lets time go on until the condition holds (false: it never
// did).
#pragma once

#include <gtest/gtest.h>

#include <atomic>
#include <memory>
#include <mutex>
#include <optional>
#include <vector>

#include "platform/base/Clock.h"
#include "platform/queues/SerialQueue.h"
#include "platform/queues/Timer.h"

namespace kyt {

template <typename Harness>
class TimerServiceContract : public testing::Test {
 protected:
  Harness harness_;
};

TYPED_TEST_SUITE_P(TimerServiceContract);

TYPED_TEST_P(TimerServiceContract, RunsWorkOnceOnItsQueueAfterItsDelay) {
  auto& h = this->harness_;
  const MonotonicTime begin = h.clock().monotonic();
  std::atomic<int> runs{0};
  std::atomic<bool> onQueue{false};
  std::atomic<Duration> took{};
  const Duration delay = std::chrono::milliseconds(5);
  TimerHandle handle = h.service().after(delay, h.queue(), [&] {
    onQueue = h.queue()->isCurrent();
    took = h.clock().monotonic() - begin;
    ++runs;
  });
  std::atomic<bool> later{false};
  TimerHandle sentinel = h.service().after(delay * 4, h.queue(), [&] { later = true; });
  ASSERT_TRUE(h.pass([&] { return later.load(); }));
  EXPECT_EQ(runs, 1);
  EXPECT_TRUE(onQueue);
  EXPECT_GE(took.load(), delay);
}

TYPED_TEST_P(TimerServiceContract, RunsWorkWithoutDelayAsSoonAsPossible) {
  auto& h = this->harness_;
  std::atomic<int> runs{0};
  TimerHandle none = h.service().after(Duration::zero(), h.queue(), [&] { ++runs; });
  TimerHandle negative = h.service().after(-std::chrono::hours(1), h.queue(), [&] { ++runs; });
  EXPECT_TRUE(h.pass([&] { return runs == 2; }));
}

TYPED_TEST_P(TimerServiceContract, RunsWorkInTheOrderOfItsTime) {
  auto& h = this->harness_;
  std::vector<int> order;  // guarded by the queue
  std::atomic<int> runs{0};
  std::vector<TimerHandle> handles;
  for (int ms : {300, 100, 200, 0})  // far more than making them takes
    handles.push_back(h.service().after(std::chrono::milliseconds(ms), h.queue(), [&, ms] {
      order.push_back(ms);
      ++runs;
    }));
  ASSERT_TRUE(h.pass([&] { return runs == 4; }));
  h.queue()->sync([&] { EXPECT_EQ(order, (std::vector<int>{0, 100, 200, 300})); });
}

TYPED_TEST_P(TimerServiceContract, NeverRunsWhatWasCancelledBefore) {
  auto& h = this->harness_;
  std::atomic<bool> later{false};
  auto token = std::make_shared<int>(0);
  TimerHandle cancelled =
      h.service().after(std::chrono::seconds(1000), h.queue(), [token] { ADD_FAILURE() << "once"; });
  TimerHandle periodic =
      h.service().every(std::chrono::seconds(1000), Duration::zero(), h.queue(), [token] { ADD_FAILURE(); });
  {
    TimerHandle dropped =
        h.service().after(std::chrono::seconds(1000), h.queue(), [token] { ADD_FAILURE(); });
    EXPECT_TRUE(dropped);
  }
  cancelled.cancel();
  periodic = TimerHandle();
  EXPECT_FALSE(cancelled);
  EXPECT_EQ(token.use_count(), 1) << "cancelled work is destroyed";
  TimerHandle sentinel = h.service().after(std::chrono::milliseconds(3), h.queue(), [&] { later = true; });
  EXPECT_TRUE(h.pass([&] { return later.load(); }));
}

TYPED_TEST_P(TimerServiceContract, RepeatsWorkUntilItIsCancelled) {
  auto& h = this->harness_;
  std::atomic<int> runs{0};
  const MonotonicTime begin = h.clock().monotonic();
  TimerHandle handle = h.service().every(std::chrono::milliseconds(2), std::chrono::milliseconds(1),
                                         h.queue(), [&] { ++runs; });
  ASSERT_TRUE(h.pass([&] { return runs >= 5; }));
  EXPECT_GE(h.clock().monotonic() - begin, std::chrono::milliseconds(10));
  handle.cancel();
  h.queue()->sync([] {});
  const int before = runs;
  std::atomic<bool> later{false};
  TimerHandle sentinel = h.service().after(std::chrono::milliseconds(10), h.queue(), [&] { later = true; });
  ASSERT_TRUE(h.pass([&] { return later.load(); }));
  EXPECT_EQ(runs, before);
}

TYPED_TEST_P(TimerServiceContract, MayBeCancelledByItsOwnWork) {
  auto& h = this->harness_;
  std::atomic<int> runs{0};
  TimerHandle handle;  // guarded by the queue
  h.queue()->sync([&] {
    handle = h.service().every(std::chrono::milliseconds(1), Duration::zero(), h.queue(), [&] {
      handle.cancel();
      ++runs;
    });
  });
  ASSERT_TRUE(h.pass([&] { return runs >= 1; }));
  std::atomic<bool> later{false};
  TimerHandle sentinel = h.service().after(std::chrono::milliseconds(5), h.queue(), [&] { later = true; });
  ASSERT_TRUE(h.pass([&] { return later.load(); }));
  EXPECT_LE(runs, 2) << "a tick that was handed to the queue already still runs, no other";
}

TYPED_TEST_P(TimerServiceContract, KeepsNothingAliveOnceItRan) {
  auto& h = this->harness_;
  auto token = std::make_shared<int>(0);
  TimerHandle handle = h.service().after(Duration::zero(), h.queue(), [token] {});
  EXPECT_TRUE(h.pass([&] { return token.use_count() == 1; }));
}

TYPED_TEST_P(TimerServiceContract, HandlesMayOutliveTheService) {
  auto& h = this->harness_;
  auto token = std::make_shared<int>(0);
  TimerHandle handle = h.service().after(std::chrono::hours(1), h.queue(), [token] { ADD_FAILURE(); });
  h.end();
  EXPECT_EQ(token.use_count(), 1);
  handle.cancel();
}

REGISTER_TYPED_TEST_SUITE_P(TimerServiceContract, RunsWorkOnceOnItsQueueAfterItsDelay,
                            RunsWorkWithoutDelayAsSoonAsPossible, RunsWorkInTheOrderOfItsTime,
                            NeverRunsWhatWasCancelledBefore, RepeatsWorkUntilItIsCancelled,
                            MayBeCancelledByItsOwnWork, KeepsNothingAliveOnceItRan,
                            HandlesMayOutliveTheService);

}  // namespace kyt
