#include "daemon/SessionCensus.h"

#include <algorithm>
#include <vector>

namespace kyt {

void SessionCensus::set(uint64_t place, int32_t clientType, uint64_t batchedEventsSize) {
  const size_t code = HealthReport::codeOf(clientType);
  const auto [known, added] = codes_.emplace(place, code);
  if (!added && known->second != code) {
    remove(place);
    codes_.emplace(place, code);
  }
  Group& group = groups_[code];
  uint64_t& size = group.sizes[place];
  group.sum += batchedEventsSize - size;
  size = batchedEventsSize;
}

void SessionCensus::remove(uint64_t place) {
  const auto known = codes_.find(place);
  if (known == codes_.end()) return;
  Group& group = groups_[known->second];
  const auto size = group.sizes.find(place);
  group.sum -= size->second;
  group.sizes.erase(size);
  codes_.erase(known);
}

uint64_t SessionCensus::addTo(HealthReport& report) const {
  std::vector<size_t> present;
  for (size_t code = 0; code < groups_.size(); ++code)
    if (!groups_[code].sizes.empty()) present.push_back(code);
  // In the order in which a walk over the list would come upon them.
  std::sort(present.begin(), present.end(), [this](size_t a, size_t b) {
    return groups_[a].sizes.begin()->first < groups_[b].sizes.begin()->first;
  });
  uint64_t sum = 0;
  for (const size_t code : present) {
    const Group& group = groups_[code];
    report.addSessions(code, static_cast<uint32_t>(group.sizes.size()), group.sum,
                       group.sizes.rbegin()->second);
    sum += group.sum;
  }
  return sum;
}

}  // namespace kyt
