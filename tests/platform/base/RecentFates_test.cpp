#include "platform/base/RecentFates.h"

#include <gtest/gtest.h>

#include <thread>
#include <vector>

namespace kyt {
namespace {

constexpr size_t kFailed = fateNumber(Reason::postFailed);

MonotonicTime at(int64_t minutes, int64_t seconds = 0) {
  return MonotonicTime(std::chrono::minutes(minutes) + std::chrono::seconds(seconds));
}

TEST(RecentFates, AreOfTheMinuteThatRunsAndTheFiftyNineBefore) {
  RecentFates fates;
  fates.addDelivered(at(1000), 7);
  fates.addDropped(at(1001, 59), kFailed, 2);
  fates.addDelivered(at(1059), 1);
  EXPECT_EQ(fates.lastHour(at(1059)).delivered, 8U);
  EXPECT_EQ(fates.lastHour(at(1059)).dropped[kFailed], 2U);
  EXPECT_EQ(fates.lastHour(at(1060)).delivered, 1U);
  EXPECT_EQ(fates.lastHour(at(1060)).droppedInAll(), 2U);
  EXPECT_EQ(fates.lastHour(at(1061)).droppedInAll(), 0U);
}

TEST(RecentFates, AreForgottenByAnIdleDaemonWithoutDoingAnything) {
  RecentFates fates;
  fates.addDelivered(at(5), 3);
  EXPECT_EQ(fates.lastHour(at(5000)).delivered, 0U);
  fates.addDelivered(at(65), 4);  // the same place
  EXPECT_EQ(fates.lastHour(at(65)).delivered, 4U);
}

TEST(RecentFates, AreCountedByManyThreadsWhileTheyAreRead) {
  RecentFates fates;
  constexpr int kEach = 2000;
  std::vector<std::thread> writers;
  for (int t = 0; t < 4; ++t)
    writers.emplace_back([&] {
      for (int i = 0; i < kEach; ++i) fates.addDelivered(at(100 + i / 100), 1);
    });
  uint64_t last = 0;
  for (int i = 0; i < 100; ++i) {
    const uint64_t seen = fates.lastHour(at(119)).delivered;
    EXPECT_GE(seen, last);
    last = seen;
  }
  for (std::thread& writer : writers) writer.join();
  EXPECT_EQ(fates.lastHour(at(119)).delivered, 4U * kEach);
}

}  // namespace
}  // namespace kyt
