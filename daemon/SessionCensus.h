// The listed sessions' figures for the health report, added up. A report visits only sessions whose figures may
// have changed since the last one, so that thousands of sessions which end at once, each with a report, cost no more
// than their number. The sums come out as if all had been visited in order. Used by the agent alone, which holds its
// monitor.
#pragma once

#include <array>
#include <cstdint>
#include <map>
#include <unordered_map>

#include "daemon/HealthReport.h"

namespace kyt {

class SessionCensus {
 public:
  // The figures of the session at `place` of the list, from now on.
  void set(uint64_t place, int32_t clientType, uint64_t batchedEventsSize);
  void remove(uint64_t place);
  // Adds all sessions, in the order of their places; returns the sum of their sizes.
  uint64_t addTo(HealthReport& report) const;

 private:
  struct Group {
    std::map<uint64_t, uint64_t> sizes;  // by place
    uint64_t sum = 0;
  };
  std::array<Group, HealthReport::kCodes> groups_;
  std::unordered_map<uint64_t, size_t> codes_;  // by place
};

}  // namespace kyt
