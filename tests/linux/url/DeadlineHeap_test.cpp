#include "platform/linux/url/DeadlineHeap.h"

#include <gtest/gtest.h>

#include <deque>
#include <random>

namespace kyt {
namespace {

using namespace std::chrono_literals;

struct Fixture : testing::Test {
  struct Entry {
    Entry(DeadlineHeap& heap, std::vector<int>& firedList, int n)
        : fired(firedList), number(n), deadline(Deadline::calling<&Entry::fire>(heap, *this)) {}
    void fire() { fired.push_back(number); }
    std::vector<int>& fired;
    int number;
    Deadline deadline;
  };
  static MonotonicTime at(Duration time) { return MonotonicTime(time); }
  DeadlineHeap heap_;
  std::vector<int> fired_;
};
using DeadlineHeapTest = Fixture;

TEST_F(DeadlineHeapTest, FiresInTheOrderOfTimeWhateverWasSetChangedAndCancelled) {
  std::mt19937 random(7);
  std::deque<Entry> entries;
  std::vector<std::pair<int, int>> expected;
  for (int i = 0; i < 500; ++i) entries.emplace_back(heap_, fired_, i);
  std::vector<int> times(500);
  for (int round = 0; round < 4; ++round) {
    for (int i = 0; i < 500; ++i) {
      times[static_cast<size_t>(i)] = static_cast<int>(random() % 100000) * 1000 + i;
      entries[static_cast<size_t>(i)].deadline.set(
          at(std::chrono::nanoseconds(times[static_cast<size_t>(i)])));
    }
  }
  for (int i = 0; i < 500; ++i) {
    if (i % 3 == 0) {
      entries[static_cast<size_t>(i)].deadline.cancel();
    } else {
      expected.emplace_back(times[static_cast<size_t>(i)], i);
    }
  }
  std::sort(expected.begin(), expected.end());
  heap_.fireUntil(at(1s));
  ASSERT_EQ(fired_.size(), expected.size());
  for (size_t i = 0; i < expected.size(); ++i) EXPECT_EQ(fired_[i], expected[i].second);
  EXPECT_EQ(heap_.millisecondsFrom(at(0s)), -1);
}

TEST_F(DeadlineHeapTest, TellsTheTimeToTheSoonestRoundedUp) {
  Entry entry(heap_, fired_, 1);
  EXPECT_EQ(heap_.millisecondsFrom(at(0s)), -1);
  entry.deadline.set(at(1500us));
  EXPECT_EQ(heap_.millisecondsFrom(at(0s)), 2);
  EXPECT_EQ(heap_.millisecondsFrom(at(5ms)), 0);
  heap_.fireUntil(at(1499us));
  EXPECT_TRUE(fired_.empty());
  heap_.fireUntil(at(1500us));
  EXPECT_EQ(fired_, std::vector<int>{1});
  EXPECT_FALSE(entry.deadline.isSet());
}

TEST_F(DeadlineHeapTest, ForgetsADestroyedDeadline) {
  { Entry(heap_, fired_, 1).deadline.set(at(1ms)); }
  heap_.fireUntil(at(1s));
  EXPECT_TRUE(fired_.empty());
}

}  // namespace
}  // namespace kyt
