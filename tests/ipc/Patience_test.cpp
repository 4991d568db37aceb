#include "platform/ipc/Patience.h"

#include <gtest/gtest.h>

#include "platform/fake/ManualClock.h"
#include "platform/fake/ManualExecutor.h"
#include "platform/fake/ManualTimers.h"
#include "platform/queues/SerialQueue.h"

namespace kyt {
namespace {

class PatienceTest : public ::testing::Test {
 protected:
  void begin() {
    patience_.begin(std::chrono::seconds(30), queue_, [this] { stalled_.push_back(patience_.ranOut()); });
  }
  void pass(int seconds) {
    timers_.advance(std::chrono::seconds(seconds));
    executor_.runAll();
  }
  ManualClock clock_;
  ManualTimers timers_{clock_};
  ManualExecutor executor_;
  const std::shared_ptr<SerialQueue> queue_ = SerialQueue::create("test", executor_);
  Patience patience_{timers_};
  std::vector<bool> stalled_;
};

TEST_F(PatienceTest, RunsOutWhenNothingWasCompletedMeanwhile) {
  begin();
  EXPECT_TRUE(patience_.running());
  pass(29);
  EXPECT_TRUE(stalled_.empty());
  pass(1);
  EXPECT_EQ(stalled_, std::vector<bool>{true});
  EXPECT_FALSE(patience_.running());
}

TEST_F(PatienceTest, SeesProgressSinceItBeganOnly) {
  patience_.sawProgress();
  begin();
  pass(30);
  begin();
  patience_.sawProgress();
  pass(30);
  EXPECT_EQ(stalled_, (std::vector<bool>{true, false}));
}

TEST_F(PatienceTest, LeavesNoTimerOnceItHasEnded) {
  begin();
  patience_.end();
  EXPECT_FALSE(patience_.running());
  EXPECT_EQ(timers_.pending(), 0u);
  pass(60);
  EXPECT_TRUE(stalled_.empty());
}

}  // namespace
}  // namespace kyt
