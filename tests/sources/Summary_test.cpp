// What a report says: equal findings once, with their number, and never more rows than its bound.
#include "sources/Summary.h"

#include <gtest/gtest.h>

namespace kyt::sources {
namespace {

constexpr uint64_t kSecond = 1'000'000;

TEST(Summary, CountsEqualFindingsInOneRowWithTheirFirstAndLastTime) {
  Summary summary(301);
  summary.add(1, {{"unit", "a.service"}}, 20 * kSecond);
  summary.add(1, {{"unit", "a.service"}}, 10 * kSecond);
  summary.add(2, {{"unit", "a.service"}}, 30 * kSecond);
  const auto events = summary.events(7);
  ASSERT_EQ(events.size(), 2U);
  EXPECT_EQ(events[0].category, 301U);
  EXPECT_EQ(events[0].type, 1U);
  EXPECT_EQ(events[0].payload,
            (Dictionary{{"unit", "a.service"}, {"count", 2}, {"first", 10}, {"last", 20}, {"report", 7}}));
  EXPECT_EQ(events[1].type, 2U);
}

TEST(Summary, CountsWhatFindsNoRowOfItsOwn) {
  Summary summary(301);
  for (size_t i = 0; i < Summary::kMostRows + 50; ++i) summary.add(1, {{"unit", std::to_string(i)}}, kSecond);
  const auto events = summary.events(1);
  ASSERT_EQ(events.size(), Summary::kMostRows + 1);
  EXPECT_EQ(events.back().type, Summary::kNotTold);
  EXPECT_EQ(events.back().payload.integer("withoutRow"), 50);
}

TEST(Summary, IsEmptyOnceItWasCleared) {
  Summary summary(301);
  for (size_t i = 0; i < Summary::kMostRows + 1; ++i) summary.add(1, {{"unit", std::to_string(i)}}, kSecond);
  summary.addUnread(5);
  summary.addWait();
  EXPECT_FALSE(summary.empty());
  summary.clear();
  EXPECT_TRUE(summary.empty());
  EXPECT_EQ(summary.events(1).size(), 0U);
}

}  // namespace
}  // namespace kyt::sources
