#include "bench/CallTimes.h"

#include <gtest/gtest.h>

#include <thread>

namespace kyt::bench {
namespace {

bool takesFiveMilliseconds(bool accepted) {
  std::this_thread::sleep_for(std::chrono::milliseconds(5));
  return accepted;
}

TEST(CallTimes, CountsTheTimeOfAcceptedCallsAlone) {
  CallTimes times;
  EXPECT_TRUE(times.time([] { return takesFiveMilliseconds(true); }));
  for (int i = 0; i < 1000; ++i) EXPECT_FALSE(times.time([] { return false; }));
  EXPECT_EQ(times.accepted(), 1u);
  EXPECT_EQ(times.refused(), 1000u);
  EXPECT_GE(times.most(0.5), 5000);
  EXPECT_GE(times.most(0), 5000);
}

TEST(CallTimes, SaysNothingOfCallsOfWhichNoneWasAccepted) {
  CallTimes times;
  EXPECT_FALSE(times.time([] { return takesFiveMilliseconds(false); }));
  EXPECT_EQ(times.accepted(), 0u);
  EXPECT_EQ(times.most(0.99), 0);
}

TEST(CallTimes, TellsTheTailFromTheMedian) {
  CallTimes times;
  EXPECT_TRUE(times.time([] { return takesFiveMilliseconds(true); }));
  for (int i = 0; i < 9; ++i) EXPECT_TRUE(times.time([] { return true; }));
  EXPECT_LT(times.most(0.5), 5000);
  EXPECT_GE(times.most(0.99), 5000);
}

}  // namespace
}  // namespace kyt::bench
