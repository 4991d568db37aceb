#include "platform/base/Counters.h"

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

TEST(Counters, AllowALineOnceAMinuteForEachSubject) {
  Counters counters;
  const MonotonicTime start{};
  EXPECT_TRUE(counters.mayTell(Reason::batchFull, "a", start));
  EXPECT_FALSE(counters.mayTell(Reason::batchFull, "a", start + seconds(59)));
  EXPECT_TRUE(counters.mayTell(Reason::batchFull, "b", start + seconds(59)));
  EXPECT_TRUE(counters.mayTell(Reason::postFailed, "a", start + seconds(59)));
  EXPECT_TRUE(counters.mayTell(Reason::batchFull, "a", start + seconds(60)));
  EXPECT_FALSE(counters.mayTell(Reason::batchFull, "a", start + seconds(61)));
}

// Clients choose subjects: what is kept of them is bounded, and room comes back with time.
TEST(Counters, KeepABoundedNumberOfSubjects) {
  Counters counters;
  const MonotonicTime start{};
  int told = 0;
  for (int i = 0; i < 2000; ++i)
    if (counters.mayTell(Reason::batchFull, std::to_string(i), start)) ++told;
  EXPECT_EQ(told, 1024);
  EXPECT_TRUE(counters.mayTell(Reason::batchFull, "1999", start + seconds(60)));
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
