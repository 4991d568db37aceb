#include "daemon/HierarchyGroup.h"

#include <limits>

#include "session/ReportingdSession.h"

namespace kyt {

uint64_t HierarchyGroup::append(Session session) {
  const uint64_t place = nextPlace_++;
  const uint32_t level = session->hierarchyLevel();
  byLevel_[{level, place}] = session.get();
  inOrder_[place] = Member{std::move(session), level};
  return place;
}

void HierarchyGroup::remove(uint64_t place) {
  const auto member = inOrder_.find(place);
  if (member == inOrder_.end()) return;
  byLevel_.erase({member->second.level, place});
  inOrder_.erase(member);
}

void HierarchyGroup::relevel(uint64_t place) {
  const auto member = inOrder_.find(place);
  if (member == inOrder_.end()) return;
  ReportingdSession* session = member->second.session.get();
  byLevel_.erase({member->second.level, place});
  member->second.level = session->hierarchyLevel();
  byLevel_[{member->second.level, place}] = session;
}

HierarchyGroup::Session HierarchyGroup::getFirstSessionWithHierarchy(uint32_t level) const {
  const auto first = byLevel_.lower_bound({level, 0});
  if (first == byLevel_.end() || first->first.first != level) return nullptr;
  return inOrder_.at(first->first.second).session;
}

HierarchyGroup::Session HierarchyGroup::firstAggregatorBelow(uint32_t level) const {
  auto first = byLevel_.begin();
  while (first != byLevel_.end() && first->first.first < level) {
    if (first->second->hasAggregator()) return inOrder_.at(first->first.second).session;
    first = byLevel_.upper_bound({first->first.first, std::numeric_limits<uint64_t>::max()});
  }
  return nullptr;
}

}  // namespace kyt
