// How the outbox's file is read at the start, also where the disk does not give all of it.
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <utility>

#include "platform/linux/files/Files.h"
#include "platform/linux/outbox/PostRecord.h"
#include "platform/linux/outbox/SQLitePostStore.h"

namespace kyt {
namespace {

using Kind = PostStoreProblem::Kind;

constexpr int64_t kGreatestNumber = int64_t{1} << 53;
// Places at which the disk does not give what lies there; more, and it gives nothing.
constexpr unsigned kMostSkips = 64;

}  // namespace

// Columns: number, record, size of the body, checksum of the head (null: of a file of the first version).
StoredPostHead SQLitePostStore::headOf(sqlite3_stmt* row) {
  const int64_t number = sqlite_->columnInteger(row, 0);
  const std::string_view record = blob(row, 1);
  StoredPostHead head;
  head.post.number = number;
  head.isUnreadable = true;
  auto post = number >= 1 && number <= kGreatestNumber ? readPostRecord(record) : std::nullopt;
  if (!post) return head;
  if (sqlite_->columnType(row, 3) == SQLITE_NULL) {
    if (!std::holds_alternative<StoredPost>(read(number))) return head;
  } else if (static_cast<uint64_t>(sqlite_->columnInteger(row, 3)) != postHeadChecksum(number, record)) {
    return head;
  }
  post->number = number;
  post->keptAt = timeOf(number, post->keptAt);
  head.bytes = PostStore::bytesOf(*post) + static_cast<uint64_t>(sqlite_->columnInteger(row, 2));
  head.isUnreadable = false;
  head.post = std::move(*post);
  head.post.headers.clear();
  return head;
}

SQLitePostStore::Problem SQLitePostStore::scan(int64_t& after, Function<void(StoredPostHead)>& found,
                                               bool& isOfOnePlace) {
  isOfOnePlace = false;
  sqlite3_stmt* rows = nullptr;
  if (Problem wrong = prepare(
          rows, "SELECT number, record, length(body), head FROM posts WHERE number >= ? ORDER BY number"))
    return wrong;
  // Not "number > after", which would look for it where that one lies.
  sqlite_->bindInteger(rows, 1, after == INT64_MAX ? after : after + 1);
  int code = SQLITE_ROW;
  while ((code = sqlite_->step(rows)) == SQLITE_ROW) {
    StoredPostHead head = headOf(rows);
    after = head.post.number;
    if (!gone_.contains(after)) found(std::move(head));
  }
  Problem wrong;
  if (code != SQLITE_DONE) wrong = problem(code, file_.c_str());
  isOfOnePlace = isOfAPlace(code);
  sqlite_->finalize(rows);
  return wrong;
}

// Rows lie in the order of their numbers, so between the last one that was read and the next one that can be found lies what
// cannot. That one is looked for at distances that double, and then halve.
SQLitePostStore::Problem SQLitePostStore::skipUnreadable(int64_t& after,
                                                         Function<void(StoredPostHead)>& found) {
  constexpr char kNext[] = "SELECT number FROM posts WHERE number >= ? ORDER BY number LIMIT 1";
  std::optional<int64_t> greatest, next;
  if (Problem wrong = query("SELECT max(number) FROM posts", greatest)) return wrong;
  if (!query(kNext, next, 0, after + 1)) {  // the row is there, what is in it is not
    if (!next) return std::nullopt;
    after = *next;
  } else {
    int64_t bad = after + 1, good = after + 2;
    for (int64_t step = 1; good <= greatest.value_or(0) && query(kNext, next, 0, good); step *= 2) {
      bad = good;
      good += step * 2;
    }
    good = std::min(good, std::max(greatest.value_or(0), bad + 1));
    while (good - bad > 1) {
      const int64_t middle = bad + (good - bad) / 2;
      (query(kNext, next, 0, middle) ? bad : good) = middle;
    }
    after = bad;
  }
  StoredPostHead lost;
  lost.post.number = after;
  lost.isUnreadable = true;
  if (!gone_.contains(after)) found(std::move(lost));
  return std::nullopt;
}

std::optional<PostStoreProblem> SQLitePostStore::open(Function<void(StoredPostHead)> found) {
  if (::access(file_.c_str(), F_OK) != 0) {
    if (errno == ENOENT) return std::nullopt;
    return PostStoreProblem{Kind::unavailable, file_ + ": " + errorText(errno)};
  }
  if (Problem wrong = begin()) return wrong;
  int64_t after = INT64_MIN;  // no post has that number
  unsigned skips = 0;
  bool isOfOnePlace = false;
  while (Problem wrong = scan(after, found, isOfOnePlace)) {
    if (!isOfOnePlace || ++skips > kMostSkips) return wrong;
    after = std::max<int64_t>(after, 0);
    if (skipUnreadable(after, found)) return wrong;
  }
  if (std::exchange(isLogDamaged_, false)) {
    StoredPostHead lost;
    lost.isUnreadable = true;
    found(std::move(lost));
  }
  return std::nullopt;
}

}  // namespace kyt
