// Counting, waiting with a deadline, and waking.
#include "platform/base/Semaphore.h"

#include <gtest/gtest.h>

#include <atomic>
#include <thread>
#include <vector>

namespace kyt {
namespace {

using namespace std::chrono_literals;

TEST(Semaphore, LetsAsManyPassAsItWasSignalled) {
  Semaphore semaphore(1);
  semaphore.signal();
  semaphore.wait();
  semaphore.wait();
  EXPECT_FALSE(semaphore.waitFor(0ms));
}

TEST(Semaphore, GivesUpAfterItsTimeout) {
  Semaphore semaphore;
  const auto begin = std::chrono::steady_clock::now();
  EXPECT_FALSE(semaphore.waitFor(5ms));
  EXPECT_GE(std::chrono::steady_clock::now() - begin, 5ms);
}

TEST(Semaphore, WakesAWaitingThread) {
  Semaphore semaphore, answer;
  std::thread other([&] {
    semaphore.wait();
    answer.signal();
  });
  semaphore.signal();
  EXPECT_TRUE(answer.waitFor(30s));
  other.join();
}

TEST(SemaphoreStress, LosesNoSignalAndMayEndRightAfterItsLastWait) {
  for (int round = 0; round < 300; ++round) {
    std::vector<std::thread> signallers;
    {
      Semaphore semaphore;
      for (int t = 0; t < 3; ++t) signallers.emplace_back([&semaphore] { semaphore.signal(); });
      for (int t = 0; t < 3; ++t) ASSERT_TRUE(semaphore.waitFor(30s));
    }
    for (auto& thread : signallers) thread.join();
  }
}

}  // namespace
}  // namespace kyt
