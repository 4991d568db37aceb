#include "sources/Summary.h"

#include <algorithm>

namespace kyt::sources {

namespace {

constexpr uint64_t kMicroseconds = 1'000'000;

}  // namespace

void Summary::add(uint32_t type, const Dictionary& fields, uint64_t microseconds) {
  const std::string key = std::to_string(type) + description(Value(fields));
  auto found = rows_.find(key);
  if (found == rows_.end()) {
    if (rows_.size() >= kMostRows) {
      ++others_;
      return;
    }
    found = rows_.emplace(key, Row{type, fields, 0, microseconds, microseconds}).first;
  }
  Row& row = found->second;
  ++row.count;
  row.first = std::min(row.first, microseconds);
  row.last = std::max(row.last, microseconds);
}

std::vector<SourceEvent> Summary::events(uint64_t report) const {
  std::vector<SourceEvent> events;
  for (const auto& [key, row] : rows_) {
    SourceEvent event{category_, row.type, row.fields};
    event.payload.set("count", row.count);
    event.payload.set("first", row.first / kMicroseconds);
    event.payload.set("last", row.last / kMicroseconds);
    event.payload.set("report", report);
    events.push_back(std::move(event));
  }
  if (hasNotTold())
    events.push_back(
        {category_, kNotTold,
         Dictionary{
             {"withoutRow", others_}, {"entriesNotRead", unread_}, {"waits", waits_}, {"report", report}}});
  return events;
}

void Summary::clear() {
  rows_.clear();
  others_ = unread_ = waits_ = 0;
}

}  // namespace kyt::sources
