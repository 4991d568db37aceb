#include "platform/Counters.h"

#include <gtest/gtest.h>

#include <set>
#include <string>

namespace kyt {
namespace {

using std::chrono::seconds;

TEST(Counters, CountEachReasonApart) {
  Counters counters;
  counters.add(Reason::batchFull);
  counters.add(Reason::batchFull, 4);
  EXPECT_EQ(counters.value(Reason::batchFull), 5U);
  EXPECT_EQ(counters.value(Reason::postFailed), 0U);
}

TEST(Counters, AllowALineOnceAMinuteForEachReason) {
  Counters counters;
  const MonotonicTime start{};
  EXPECT_TRUE(counters.addAndMayLog(Reason::batchFull, start));
  EXPECT_FALSE(counters.addAndMayLog(Reason::batchFull, start));
  EXPECT_FALSE(counters.addAndMayLog(Reason::batchFull, start + seconds(59), 3));
  EXPECT_TRUE(counters.addAndMayLog(Reason::postFailed, start + seconds(59)));
  EXPECT_TRUE(counters.addAndMayLog(Reason::batchFull, start + seconds(61)));
  EXPECT_FALSE(counters.addAndMayLog(Reason::batchFull, start + seconds(62)));
  EXPECT_EQ(counters.value(Reason::batchFull), 7U);
}

TEST(Counters, NameEveryReasonDifferently) {
  std::set<std::string> names;
  for (int i = 0; i < static_cast<int>(Reason::numberOfReasons); ++i)
    names.insert(reasonName(static_cast<Reason>(i)));
  EXPECT_EQ(names.size(), static_cast<size_t>(Reason::numberOfReasons));
  EXPECT_EQ(names.count("unknown"), 0U);
}

}  // namespace
}  // namespace kyt
