#include "platform/queues/LineLimits.h"

#include <gtest/gtest.h>

#include "platform/base/Limits.h"
#include "platform/fake/ManualClock.h"
#include "platform/fake/ManualExecutor.h"
#include "platform/fake/ManualTimers.h"
#include "platform/fake/MemoryLogSink.h"
#include "platform/queues/Log.h"
#include "platform/queues/SerialQueue.h"

namespace kyt {
namespace {

constexpr unsigned kMost = Limits::maxLogLinesPerSecond;

class LinesOfAUser : public ::testing::Test {
 protected:
  void flood(uint32_t user, unsigned count) {
    const ClientScope scope(user);
    for (unsigned i = 0; i < count; ++i) log_.normal("flood: line %u", i);
  }
  void pass(std::chrono::milliseconds time) {
    timers_.advance(time);
    executor_.runAll();
  }
  [[nodiscard]] size_t written() const { return lines("flood: line ") - lines("left out"); }
  [[nodiscard]] size_t lines(std::string_view text) const { return sink_.count(LogLevel::normal, text); }

  MemoryLogSink sink_;
  Log log_{sink_, LogLevel::debug};
  ManualClock clock_;
  ManualTimers timers_{clock_};
  ManualExecutor executor_;
  LineLimits limits_{log_, clock_, timers_, SerialQueue::create("test", executor_), kMost};
};

TEST_F(LinesOfAUser, PastTheMostOfASecondAreLeftOutAndTold) {
  flood(1000, kMost + 300);
  EXPECT_EQ(written(), kMost);
  EXPECT_EQ(lines("left out"), 0u);
  pass(std::chrono::seconds(1));
  EXPECT_EQ(lines("Log(write): 300 lines of clients of user 1000 left out, of this kind: flood: line %u"),
            1u);
  flood(1000, 1);
  EXPECT_EQ(written(), kMost + 1);
  EXPECT_EQ(timers_.pending(), 0u) << "nothing is waited for when nothing was left out";
}

TEST_F(LinesOfAUser, AreWrittenAsLongAsTheyAreFewASecond) {
  for (int second = 0; second < 5; ++second) {
    flood(1000, kMost);
    pass(std::chrono::seconds(1));
  }
  EXPECT_EQ(written(), 5 * kMost);
  EXPECT_EQ(lines("left out"), 0u);
}

TEST_F(LinesOfAUser, LeaveAnothersAndOtherTextsAndTheDaemonsOwnAlone) {
  flood(1000, 10 * kMost);
  flood(1001, 1);
  EXPECT_EQ(written(), kMost + 1);
  {
    const ClientScope scope(1000u);
    log_.normal("another: line");
    log_.error("failure: line");
  }
  EXPECT_EQ(lines("another: line"), 1u);
  EXPECT_EQ(sink_.count(LogLevel::error, "failure: line"), 1u);
  for (unsigned i = 0; i < 2 * kMost; ++i) log_.normal("own: line");
  EXPECT_EQ(lines("own: line"), 2 * kMost);
}

TEST_F(LinesOfAUser, OfTheDebugLevelAreNeverLeftOut) {
  const ClientScope scope(1000u);
  for (unsigned i = 0; i < 5 * kMost; ++i) log_.debug("detail: line");
  EXPECT_EQ(sink_.count(LogLevel::debug, "detail: line"), 5 * kMost);
}

TEST_F(LinesOfAUser, AreToldAtTheEndToo) {
  flood(1000, kMost + 1);
  limits_.finish();
  EXPECT_EQ(lines("Log(write): 1 lines of clients of user 1000 left out"), 1u);
  flood(1000, kMost + 1);
  EXPECT_EQ(written(), 2 * kMost + 1);
}

TEST(ClientScope, EndsWithItself) {
  EXPECT_EQ(ClientScope::user(), std::nullopt);
  {
    const ClientScope outer(1u);
    {
      const ClientScope inner(2u);
      EXPECT_EQ(ClientScope::user(), 2u);
    }
    EXPECT_EQ(ClientScope::user(), 1u);
  }
  EXPECT_EQ(ClientScope::user(), std::nullopt);
}

}  // namespace
}  // namespace kyt
