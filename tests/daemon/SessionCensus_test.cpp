#include "daemon/SessionCensus.h"

#include <gtest/gtest.h>

#include <map>
#include <random>
#include <utility>

namespace kyt {
namespace {

// What a walk over all sessions, in their order, would write.
Dictionary walked(const std::map<uint64_t, std::pair<int32_t, uint64_t>>& sessions) {
  HealthReport report;
  for (const auto& [place, session] : sessions) report.addSession(session.first, session.second);
  Dictionary payload;
  report.write(payload);
  return payload;
}

TEST(SessionCensus, WritesWhatAWalkOverAllSessionsWould) {
  std::mt19937_64 random(7);
  SessionCensus census;
  std::map<uint64_t, std::pair<int32_t, uint64_t>> sessions;
  uint64_t next = 0;
  for (int step = 0; step < 3000; ++step) {
    const uint64_t place = random() % 3 == 0 || sessions.empty() ? next++ : random() % next;
    if (random() % 4 == 0) {
      sessions.erase(place);
      census.remove(place);
    } else {
      // Some past 32 bits, where what was there before each counts by its last 32 alone.
      const auto session = std::pair(static_cast<int32_t>(random() % 30) - 2, random() >> (random() % 64));
      sessions[place] = session;
      census.set(place, session.first, session.second);
    }
    HealthReport report;
    uint64_t sum = 0;
    for (const auto& [at, session] : sessions) sum += session.second;
    EXPECT_EQ(census.addTo(report), sum);
    Dictionary payload;
    report.write(payload);
    const Dictionary expected = walked(sessions);
    ASSERT_EQ(payload, expected) << step;
    for (size_t i = 0; i < payload.size(); ++i)
      ASSERT_EQ((payload.begin() + i)->key, (expected.begin() + i)->key) << "in another order";
  }
}

TEST(SessionCensus, AddsTheSessionThatAsksAfterTheOthers) {
  SessionCensus census;
  census.set(0, 7, 0x1'0000'0001);
  census.set(1, 7, 5);
  HealthReport report;
  EXPECT_EQ(census.addTo(report), 0x1'0000'0006U);
  report.addSession(7, 3);
  Dictionary payload;
  report.write(payload);
  EXPECT_EQ(*payload.find("SessionsCount_QH"), Value(3));
  EXPECT_EQ(*payload.find("BatchSize_QH"), Value(1 + 5 + 3));
}

}  // namespace
}  // namespace kyt
