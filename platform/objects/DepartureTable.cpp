#include "platform/objects/DepartureTable.h"

#include <algorithm>
#include <array>
#include <cmath>
#include <optional>
#include <utility>

namespace kyt {

namespace {

constexpr std::array<DepartureKind, 3> kKinds = {DepartureKind::events, DepartureKind::file,
                                                 DepartureKind::logData};
constexpr int64_t kFormat = 1;

int64_t hourOf(double seconds) {
  return static_cast<int64_t>(std::floor(seconds / 3600));
}

uint64_t numberAt(const Dictionary& row, const char* key) {
  const Value* value = row.find(key);
  if (value == nullptr) return 0;
  if (const auto number = value->unsignedInteger()) return *number;
  const auto number = value->integer();
  return number && *number > 0 ? static_cast<uint64_t>(*number) : 0;
}

double secondsAt(const Dictionary& row, const char* key) {
  const Value* value = row.find(key);
  const double seconds = value != nullptr ? value->doubleValue() : 0;
  return std::isfinite(seconds) && std::abs(seconds) < 1e12 ? seconds : 0;
}

std::string cut(std::string text) {
  if (text.size() <= DepartureTable::kMostNameBytes) return text;
  text.resize(DepartureTable::kMostNameBytes);
  // No half of a character.
  while (!text.empty() && (static_cast<unsigned char>(text.back()) & 0xC0) == 0x80) text.pop_back();
  if (!text.empty() && static_cast<unsigned char>(text.back()) >= 0xC0) text.pop_back();
  return text;
}

std::string textAt(const Dictionary& row, const char* key) {
  const String* text = row.string(key);
  return text != nullptr ? cut(text->str()) : "";
}

std::optional<DepartureKind> kindNamed(const std::string& name) {
  for (const DepartureKind kind : kKinds)
    if (name == nameOf(kind)) return kind;
  return std::nullopt;
}

void addTo(DepartureTable::Sum& sum, const DepartureTable::Sum& more) {
  sum.posts += more.posts;
  sum.events += more.events;
  sum.bytes += more.bytes;
  sum.unanswered += more.unanswered;
  sum.last = std::max(sum.last, more.last);
}

}  // namespace

const char* nameOf(DepartureKind kind) {
  switch (kind) {
    case DepartureKind::events:
      return "events";
    case DepartureKind::file:
      return "file";
    case DepartureKind::logData:
      return "log-data";
  }
  return "";
}

void DepartureTable::add(const Departure& departure, double now) {
  dropOld(now);
  Key key{hourOf(now), departure.program, cut(departure.server), departure.kind};
  key.program.clientName = cut(std::move(key.program.clientName));
  key.program.service = cut(std::move(key.program.service));
  const bool isFull = rows_.size() >= kMostRows;
  if (!rows_.contains(key) && (isFull || rowsOf(key.program.user) >= kMostRowsOfUser)) {
    const uint32_t user = isFull ? kManyUsers : key.program.user;
    key.program = ReportingProgram();
    key.program.user = user;
    key.program.clientType = kManyPrograms;
    key.server.clear();
  }
  addTo(rows_[key], {1, departure.events, departure.bytes, departure.isAnswered ? 0U : 1U, now});
}

size_t DepartureTable::rowsOf(uint32_t user) const {
  return static_cast<size_t>(std::count_if(rows_.begin(), rows_.end(), [user](const auto& row) {
    return row.first.program.user == user && row.first.program.clientType != kManyPrograms;
  }));
}

void DepartureTable::dropOld(double now) {
  const int64_t oldest = hourOf(now) - kHours;
  while (!rows_.empty() && rows_.begin()->first.hour < oldest) rows_.erase(rows_.begin());
}

Dictionary DepartureTable::object() const {
  Array rows;
  for (const auto& [key, sum] : rows_)
    rows.append(Dictionary{{"hour", key.hour},
                           {"user", key.program.user},
                           {"clientType", key.program.clientType},
                           {"clientName", std::string_view(key.program.clientName)},
                           {"service", std::string_view(key.program.service)},
                           {"server", std::string_view(key.server)},
                           {"kind", nameOf(key.kind)},
                           {"posts", sum.posts},
                           {"events", sum.events},
                           {"bytes", sum.bytes},
                           {"unanswered", sum.unanswered},
                           {"last", sum.last}});
  return {{"format", kFormat}, {"since", since_}, {"rows", std::move(rows)}};
}

DepartureTable DepartureTable::of(const Value& object) {
  const Dictionary* all = object.dictionary();
  if (all == nullptr || numberAt(*all, "format") != static_cast<uint64_t>(kFormat)) return DepartureTable();
  DepartureTable table(secondsAt(*all, "since"));
  const Value* rows = all->find("rows");
  if (rows == nullptr || rows->array() == nullptr) return table;
  for (const Value& value : *rows->array()) {
    const Dictionary* row = value.dictionary();
    if (row == nullptr || table.rows_.size() >= kMostRows) continue;
    const auto kind = kindNamed(textAt(*row, "kind"));
    if (!kind) continue;
    Key key;
    key.hour = static_cast<int64_t>(std::min<uint64_t>(numberAt(*row, "hour"), 1U << 30));
    key.program.user = static_cast<uint32_t>(numberAt(*row, "user"));
    const Value* type = row->find("clientType");
    key.program.clientType = type != nullptr ? static_cast<int32_t>(type->longLongValue()) : 0;
    key.program.clientName = textAt(*row, "clientName");
    key.program.service = textAt(*row, "service");
    key.server = textAt(*row, "server");
    key.kind = *kind;
    addTo(table.rows_[key], {numberAt(*row, "posts"), numberAt(*row, "events"), numberAt(*row, "bytes"),
                             numberAt(*row, "unanswered"), secondsAt(*row, "last")});
  }
  return table;
}

}  // namespace kyt
