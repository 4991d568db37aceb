#include "daemon/HierarchyGroup.h"

#include <utility>

#include "session/ReportingdSession.h"

namespace kyt {

uint64_t HierarchyGroup::append(Session session) {
  runs_.reset();
  const uint64_t place = nextPlace_++;
  const uint32_t level = session->hierarchyLevel();
  byLevel_[{level, place}] = session.get();
  inOrder_[place] = Member{std::move(session), level};
  lookForAggregator(level);
  return place;
}

void HierarchyGroup::remove(uint64_t place) {
  const auto member = inOrder_.find(place);
  if (member == inOrder_.end()) return;
  runs_.reset();
  const uint32_t level = member->second.level;
  byLevel_.erase({level, place});
  inOrder_.erase(member);
  lookForAggregator(level);
}

void HierarchyGroup::relevel(uint64_t place) {
  const auto member = inOrder_.find(place);
  if (member == inOrder_.end()) return;
  runs_.reset();
  ReportingdSession* session = member->second.session.get();
  const uint32_t former = std::exchange(member->second.level, session->hierarchyLevel());
  byLevel_.erase({former, place});
  byLevel_[{member->second.level, place}] = session;
  lookForAggregator(former);
  lookForAggregator(member->second.level);
}

void HierarchyGroup::aggregationMayHaveChanged(uint64_t place) {
  const auto member = inOrder_.find(place);
  if (member != inOrder_.end()) lookForAggregator(member->second.level);
}

void HierarchyGroup::lookForAggregator(uint32_t level) {
  Session first = getFirstSessionWithHierarchy(level);
  if (first != nullptr && first->hasAggregator())
    aggregators_[level] = std::move(first);
  else
    aggregators_.erase(level);
}

HierarchyGroup::Session HierarchyGroup::getFirstSessionWithHierarchy(uint32_t level) const {
  const auto first = byLevel_.lower_bound({level, 0});
  if (first == byLevel_.end() || first->first.first != level) return nullptr;
  return inOrder_.at(first->first.second).session;
}

HierarchyGroup::Session HierarchyGroup::firstAggregatorBelow(uint32_t level) const {
  const auto first = aggregators_.begin();
  return first != aggregators_.end() && first->first < level ? first->second : nullptr;
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
