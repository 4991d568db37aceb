#include "daemon/HierarchyGroup.h"

#include <limits>

#include "session/ReportingdSession.h"

namespace kyt {

uint64_t HierarchyGroup::append(Session session) {
  runs_.reset();
  const uint64_t place = nextPlace_++;
  const uint32_t level = session->hierarchyLevel();
  byLevel_[{level, place}] = session.get();
  inOrder_[place] = Member{std::move(session), level};
  return place;
}

void HierarchyGroup::remove(uint64_t place) {
  const auto member = inOrder_.find(place);
  if (member == inOrder_.end()) return;
  runs_.reset();
  byLevel_.erase({member->second.level, place});
  inOrder_.erase(member);
}

void HierarchyGroup::relevel(uint64_t place) {
  const auto member = inOrder_.find(place);
  if (member == inOrder_.end()) return;
  runs_.reset();
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

HierarchyGroup::Runs HierarchyGroup::runs() const {
  Runs runs;
  Run* last = nullptr;
  uint64_t next = 0;
  for (const auto& [key, session] : byLevel_) {
    const uint32_t level = key.first;
    if (last == nullptr || level > next) {
      last = &runs[level];
      last->identifiers = std::make_shared<std::string>();
      next = level;
    } else if (level < next) {
      continue;  // not the first of its level
    }
    if (!last->ends.empty()) *last->identifiers += '.';
    *last->identifiers += session->sessionIDString().view();
    last->ends.push_back(last->identifiers->size());
    ++next;
  }
  return runs;
}

HierarchyGroup::Ancestors HierarchyGroup::ancestorsOf(uint32_t level) const {
  if (level == 0) return {};
  if (!runs_) runs_ = runs();
  auto found = runs_->lower_bound(level);
  if (found == runs_->begin()) return {};
  const auto& [first, run] = *--found;
  if (level - first > run.ends.size()) return {};
  return {AncestorIdentifiers{run.identifiers, run.ends[level - first - 1]}, first == 0};
}

}  // namespace kyt
