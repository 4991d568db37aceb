// The sessions that carry one hierarchy token, in the order of their registration. A level is a number that a
// client chose, up to 2^32-1, so look-ups go over the levels that sessions hold and never count through them.
// Used by the agent alone, which holds its monitor.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "backend/SessionIDPath.h"

namespace kyt {

class ReportingdSession;

class HierarchyGroup {
 public:
  using Session = std::shared_ptr<ReportingdSession>;

  // At the end, under the session's present level. Returns the place in the order, the session's handle here.
  uint64_t append(Session session);
  void remove(uint64_t place);
  // The session at `place` has changed its level. It keeps its place.
  void relevel(uint64_t place);
  // … or begins or stops aggregating.
  void aggregationMayHaveChanged(uint64_t place);

  [[nodiscard]] bool contains(uint64_t place) const { return inOrder_.count(place) != 0; }
  [[nodiscard]] bool empty() const { return inOrder_.empty(); }
  [[nodiscard]] size_t size() const { return inOrder_.size(); }
  // The first in order whose level that is, or null.
  [[nodiscard]] Session getFirstSessionWithHierarchy(uint32_t level) const;
  // Of the levels below `level`, lowest first, the first session that aggregates; only the first session of
  // each level counts. Asked for each message, so the same however many sessions and levels there are.
  [[nodiscard]] Session firstAggregatorBelow(uint32_t level) const;
  // The identifiers of the ancestors of a session at `level`, root first and joined by ".": those of the first
  // sessions of the levels right above it, up to the first level that nobody holds. None when that is the
  // next one above.
  struct Ancestors {
    std::optional<AncestorIdentifiers> identifiers;
    bool complete = false;  // up to level 0
  };
  [[nodiscard]] Ancestors ancestorsOf(uint32_t level) const;
  // (place, session), in order. The group must not change during an enumeration.
  struct Member {
    Session session;
    uint32_t level;
  };
  [[nodiscard]] auto begin() const { return inOrder_.begin(); }
  [[nodiscard]] auto end() const { return inOrder_.end(); }

 private:
  // Levels that follow one another without a gap. What stands above a level is the beginning of its run's
  // text, which all share, so that thousands of levels beneath each other cost no more than they are long.
  struct Run {
    std::shared_ptr<std::string> identifiers;  // of all its levels
    std::vector<size_t> ends;                  // of each level's identifier
  };
  using Runs = std::map<uint32_t, Run>;  // by the first level
  [[nodiscard]] Runs runs() const;
  void lookForAggregator(uint32_t level);

  uint64_t nextPlace_ = 1;
  std::map<uint64_t, Member> inOrder_;
  std::map<std::pair<uint32_t, uint64_t>, ReportingdSession*> byLevel_;  // (level, place)
  std::map<uint32_t, Session> aggregators_;  // by level, where the first session of the level is one
  mutable std::optional<Runs> runs_;         // until the group changes
};

}  // namespace kyt
