// What a source found in one period, summed up: equal findings are one row with a count. Bounded: what finds no row of
// its own is counted in one for all of these. One thread.
#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <vector>

#include "platform/objects/Value.h"

namespace kyt::sources {

struct SourceEvent {
  uint32_t category = 0, type = 0;
  Dictionary payload;
};

// Of one that `kytctl events generate` has made.
template <typename Generated>
[[nodiscard]] SourceEvent sourceEvent(const Generated& event) {
  return {Generated::kCategory, Generated::kType, event.payload()};
}

class Summary {
 public:
  explicit Summary(uint32_t category) : category_(category) {}
  // Rows of their own; a device where more units fail at once has another problem than which.
  static constexpr size_t kMostRows = 200;
  // The type of the event that counts what has no row, what nobody read, and how often a report was not taken.
  static constexpr uint32_t kNotTold = 9;

  // One finding of that type, told apart by its fields; the time is in microseconds since 1970.
  void add(uint32_t type, const Dictionary& fields, uint64_t microseconds);
  // Journal entries that nobody read.
  void addUnread(uint64_t entries) { unread_ += entries; }
  // A report that was not taken, and is tried again later.
  void addWait() { ++waits_; }
  // The rows as events: each with "count", "first" and "last" (whole seconds since 1970), and the report's number.
  [[nodiscard]] std::vector<SourceEvent> events(uint64_t report) const;
  void clear();
  [[nodiscard]] bool empty() const { return rows_.empty() && !hasNotTold(); }

 private:
  struct Row {
    uint32_t type = 0;
    Dictionary fields;
    uint64_t count = 0, first = 0, last = 0;
  };
  [[nodiscard]] bool hasNotTold() const { return others_ != 0 || unread_ != 0 || waits_ != 0; }
  const uint32_t category_;
  std::map<std::string, Row> rows_;
  uint64_t others_ = 0, unread_ = 0, waits_ = 0;
};

}  // namespace kyt::sources
