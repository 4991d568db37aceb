// The timer service of tests, and the contract that it shares with the real one.
#include "platform/fake/ManualTimers.h"

#include <gtest/gtest.h>

#include "platform/fake/ManualExecutor.h"
#include "tests/support/TimerServiceContract.h"

namespace kyt {
namespace {

class ManualHarness {
 public:
  TimerService& service() { return *timers_; }
  const std::shared_ptr<SerialQueue>& queue() { return queue_; }
  Clock& clock() { return clock_; }
  template <typename Condition>
  [[nodiscard]] bool pass(Condition condition) {
    for (int ms = 0; ms < 1000 && !condition(); ++ms)
      timers_->advance(ms == 0 ? Duration::zero() : Duration(std::chrono::milliseconds(1)),
                       [this] { executor_.runAll(); });
    return condition();
  }
  void end() { timers_.reset(); }

 private:
  ManualClock clock_;
  ManualExecutor executor_;
  std::shared_ptr<SerialQueue> queue_ = SerialQueue::create("timers", executor_);
  std::unique_ptr<ManualTimers> timers_ = std::make_unique<ManualTimers>(clock_);
};

INSTANTIATE_TYPED_TEST_SUITE_P(Manual, TimerServiceContract, ManualHarness);

TEST(ManualTimers, MovesTheClockToEachDueTimeInTurn) {
  ManualClock clock;
  ManualExecutor executor;
  ManualTimers timers(clock);
  auto queue = SerialQueue::create("test", executor);
  const MonotonicTime begin = clock.monotonic();
  std::vector<Duration> seen;
  TimerHandle handle = timers.every(std::chrono::seconds(2), Duration::zero(), queue,
                                    [&] { seen.push_back(clock.monotonic() - begin); });
  timers.advance(std::chrono::seconds(5), [&] { executor.runAll(); });
  EXPECT_EQ(seen, (std::vector<Duration>{std::chrono::seconds(2), std::chrono::seconds(4)}));
  EXPECT_EQ(clock.monotonic() - begin, std::chrono::seconds(5));
  EXPECT_EQ(timers.pending(), 1u);
}

TEST(ManualTimers, RunsNothingItself) {
  ManualClock clock;
  ManualExecutor executor;
  ManualTimers timers(clock);
  auto queue = SerialQueue::create("test", executor);
  bool ran = false;
  TimerHandle handle = timers.after(std::chrono::seconds(1), queue, [&] { ran = true; });
  timers.advance(std::chrono::seconds(1));
  EXPECT_FALSE(ran);
  EXPECT_EQ(executor.pending(), 1u);
  executor.runAll();
  EXPECT_TRUE(ran);
}

TEST(ManualClock, MovesBothReadingsAndCarriesMicroseconds) {
  ManualClock clock;
  clock.setTimeOfDay({100, 999999});
  const MonotonicTime before = clock.monotonic();
  clock.advance(std::chrono::microseconds(3));
  EXPECT_EQ(clock.timeOfDay(), (TimeValue{101, 2}));
  EXPECT_EQ(clock.monotonic() - before, std::chrono::microseconds(3));
  clock.setMonotonic(MonotonicTime(std::chrono::seconds(5)));
  EXPECT_EQ(clock.monotonic(), MonotonicTime(std::chrono::seconds(5)));
  EXPECT_EQ(clock.timeOfDay(), (TimeValue{101, 2}));
}

}  // namespace
}  // namespace kyt
