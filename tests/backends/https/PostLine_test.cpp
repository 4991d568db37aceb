#include "backends/https/PostLine.h"

#include <gtest/gtest.h>

#include <atomic>
#include <string>
#include <thread>
#include <vector>

#include "platform/base/Semaphore.h"
#include "tests/support/Eventually.h"
#include "tests/support/TestPlatform.h"

namespace kyt {
namespace {

class PostLineTest : public testing::Test {
 protected:
  Function<void()> note(int number) {
    return [this, number] { done_.push_back(number); };
  }
  TestPlatform platform_;
  ManualExecutor& executor_ = platform_.executor;
  std::vector<int> done_;
  PostLine line_{executor_};
};

TEST_F(PostLineTest, RunsPostsBesideTheTurnInTheirOrder) {
  {
    const Turn turn;
    line_.add(note(1));
    line_.add(note(2));
    EXPECT_EQ(executor_.pending(), 1u) << "a worker is asked for within the turn";
  }
  EXPECT_TRUE(done_.empty()) << "and the turn does not run them itself";
  executor_.runAll();
  EXPECT_EQ(done_, (std::vector<int>{1, 2}));
}

TEST_F(PostLineTest, LetsNoMoreThanTwoWait) {
  for (int number = 1; number <= 3; ++number) line_.add(note(number));
  EXPECT_EQ(done_, (std::vector<int>{1, 2})) << "who comes third does the work of those before";
  executor_.runAll();
  EXPECT_EQ(done_, (std::vector<int>{1, 2, 3}));
}

TEST_F(PostLineTest, RunsAPostAtOnceAndAfterThoseBeforeWhereOthersWaitForThreads) {
  executor_.setMuchReady(true);
  line_.add(note(1));
  EXPECT_EQ(done_, std::vector<int>{1});
  executor_.setMuchReady(false);
  line_.add(note(2));
  EXPECT_EQ(done_, std::vector<int>{1});
  executor_.setMuchReady(true);
  line_.add(note(3));
  EXPECT_EQ(done_, (std::vector<int>{1, 2, 3}));
}

TEST_F(PostLineTest, FinishesOnTheCallersThreadWhatHasNotBegun) {
  line_.finish();
  const auto caller = std::this_thread::get_id();
  std::thread::id ran;
  line_.add([&] { ran = std::this_thread::get_id(); });
  line_.add(note(2));
  line_.finish();
  EXPECT_EQ(ran, caller);
  EXPECT_EQ(done_, std::vector<int>{2});
  executor_.runAll();
  EXPECT_EQ(done_, std::vector<int>{2}) << "once";
}

TEST_F(PostLineTest, FinishesNotBeforeWhatAnotherThreadRuns) {
  Semaphore goOn;
  std::atomic<bool> begun{false}, ended{false};
  line_.add([&] {
    begun = true;
    goOn.wait();
    ended = true;
  });
  std::jthread worker([&] { executor_.runAll(); });
  ASSERT_TRUE(eventually([&] { return begun.load(); }));
  line_.add(note(2));
  line_.add(note(3));  // what is under way does not wait
  std::atomic<bool> finished{false};
  std::jthread other([&] {
    EXPECT_TRUE(eventually([&] { return begun.load(); }));
    EXPECT_FALSE(finished.load());
    goOn.signal();
  });
  line_.finish();
  finished = true;
  EXPECT_TRUE(ended);
  EXPECT_EQ(done_, (std::vector<int>{2, 3}));
}

}  // namespace
}  // namespace kyt
