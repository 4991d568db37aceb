// Threads that wait for a session's goodbye or its end.
#include "client/Waiters.h"

#include <gtest/gtest.h>

#include <thread>

#include "tests/support/Eventually.h"

namespace kyt::client {
namespace {

using std::chrono::milliseconds;

TEST(Waiters, LearnThatAGoodbyeWasAnswered) {
  Waiters waiters;
  std::thread daemon([&] { waiters.goodbyeAnswered(true); });
  EXPECT_TRUE(waiters.waitForGoodbye(kTestDeadline));
  daemon.join();
}

TEST(Waiters, LearnThatAGoodbyeFailedWithoutWaitingLonger) {
  Waiters waiters;
  waiters.goodbyeAnswered(false);
  EXPECT_FALSE(waiters.waitForGoodbye(std::chrono::hours(1)));
}

TEST(Waiters, BelieveTheGoodbyeThatSucceededWhateverASecondOneSays) {
  Waiters waiters;
  waiters.goodbyeAnswered(true);
  waiters.goodbyeAnswered(false);
  EXPECT_TRUE(waiters.waitForGoodbye(std::chrono::hours(1)));
}

TEST(Waiters, WaitForAGoodbyeNoLongerThanTheyWereTold) {
  Waiters waiters;
  const auto begin = std::chrono::steady_clock::now();
  EXPECT_FALSE(waiters.waitForGoodbye(milliseconds(5)));
  EXPECT_GE(std::chrono::steady_clock::now() - begin, milliseconds(5));
  EXPECT_FALSE(waiters.waitForGoodbye(milliseconds(-1)));
}

TEST(Waiters, AreAllWokenByTheEndOfTheSession) {
  Waiters waiters;
  std::thread finishing([&] { EXPECT_FALSE(waiters.waitForGoodbye(kTestDeadline)); });
  std::thread closing([&] { waiters.waitForEnd(); });
  waiters.sessionEnded();
  finishing.join();
  closing.join();
  waiters.waitForEnd();
}

}  // namespace
}  // namespace kyt::client
