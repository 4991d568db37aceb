// What left in the last day, added up by hour, program, server and kind: at most kMostRows rows, so whoever makes up names
// makes no more of them, and no user takes more than a part. What finds no room is added up for each hour under no name, of
// its user where he has used up his part. Has a form as an object, for a file.
//
// One thread at a time.
#pragma once

#include <compare>
#include <cstddef>
#include <cstdint>
#include <map>
#include <string>

#include "platform/base/Departures.h"
#include "platform/objects/Value.h"

namespace kyt {

class DepartureTable {
 public:
  static constexpr size_t kMostRows = 2048;       // some 250 bytes each in a file: half a megabyte
  static constexpr size_t kMostRowsOfUser = 512;  // besides those of what found no room
  static constexpr size_t kMostNameBytes = 256;   // of each name of a row
  static constexpr int64_t kHours = 24;           // besides the one that runs
  static constexpr int32_t kManyPrograms = -1;    // the client type of rows that stand for what found no room
  static constexpr uint32_t kManyUsers = UINT32_MAX;  // the user of such rows, where they are of several

  struct Key {
    int64_t hour = 0;  // hours since 1970
    ReportingProgram program;
    std::string server;
    DepartureKind kind = DepartureKind::events;
    friend auto operator<=>(const Key&, const Key&) = default;
  };
  struct Sum {
    uint64_t posts = 0, events = 0, bytes = 0;
    uint64_t unanswered = 0;  // of the posts
    double last = 0;          // seconds since 1970
  };

  // Times are in seconds since 1970. A table that begins at `since` knows nothing of before.
  explicit DepartureTable(double since = 0) : since_(since) {}

  void add(const Departure& departure, double now);
  // Without what is older than a day.
  void dropOld(double now);

  [[nodiscard]] double since() const { return since_; }
  [[nodiscard]] const std::map<Key, Sum>& rows() const { return rows_; }

  [[nodiscard]] Dictionary object() const;
  // What in it has the form of object(); the rest is left out.
  [[nodiscard]] static DepartureTable of(const Value& object);

 private:
  [[nodiscard]] size_t rowsOf(uint32_t user) const;

  double since_;
  std::map<Key, Sum> rows_;
};

[[nodiscard]] const char* nameOf(DepartureKind kind);  // "events", "file", "log-data"

}  // namespace kyt
