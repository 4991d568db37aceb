// What the outbox's file says beside its posts.
#include <string>
#include <vector>

#include "platform/base/Limits.h"
#include "platform/linux/outbox/SQLitePostStore.h"

namespace kyt {

SQLitePostStore::Problem SQLitePostStore::executeAsAWhole(const std::string& sql) {
  Problem wrong = execute(("BEGIN IMMEDIATE; " + sql + "COMMIT").c_str());
  if (wrong && sqlite_->isAutoCommit(database_) == 0)
    static_cast<void>(sqlite_->execute(database_, "ROLLBACK", nullptr, nullptr, nullptr));
  return wrong;
}

std::optional<PostStoreProblem> SQLitePostStore::setLatest(int64_t number, int64_t time) {
  if (Problem wrong = begin()) return wrong;
  const std::string row = std::to_string(number) + ", " + std::to_string(time);
  Problem wrong = executeAsAWhole("INSERT OR REPLACE INTO latest VALUES (" + row +
                                  "); DELETE FROM latest WHERE number < (SELECT min(number) FROM posts); ");
  if (!wrong) latest_[number] = time;
  return wrong;
}

int64_t SQLitePostStore::note(Note name) {
  std::optional<int64_t> value;
  if (!isThere() || begin() ||
      query("SELECT value FROM notes WHERE name = ?", value, 0, static_cast<int64_t>(name)))
    return 0;
  return value.value_or(0);
}

std::optional<PostStoreProblem> SQLitePostStore::setNote(Note name, int64_t value) {
  if (Problem wrong = begin()) return wrong;
  return execute(("INSERT OR REPLACE INTO notes VALUES (" + std::to_string(static_cast<int64_t>(name)) +
                  ", " + std::to_string(value) + ")")
                     .c_str());
}

std::vector<PostStore::ServerPause> SQLitePostStore::pauses() {
  std::vector<ServerPause> found;
  sqlite3_stmt* rows = nullptr;
  if (!isThere() || begin() || prepare(rows, "SELECT server, since, until FROM pauses")) return found;
  while (found.size() < Limits::maxOutboxPauses && sqlite_->step(rows) == SQLITE_ROW)
    found.push_back({static_cast<uint64_t>(sqlite_->columnInteger(rows, 0)), sqlite_->columnInteger(rows, 1),
                     sqlite_->columnInteger(rows, 2)});
  sqlite_->finalize(rows);
  return found;
}

std::optional<PostStoreProblem> SQLitePostStore::setPauses(std::span<const ServerPause> pauses) {
  std::string sql;
  bool hasEnds = false;
  for (const ServerPause& pause : pauses) {
    const std::string server = std::to_string(static_cast<int64_t>(pause.server));
    hasEnds = hasEnds || pause.until != 0;
    sql += pause.until == 0 ? "DELETE FROM pauses WHERE server = " + server
                            : "INSERT OR REPLACE INTO pauses VALUES (" + server + ", " +
                                  std::to_string(pause.since) + ", " + std::to_string(pause.until) + ")";
    sql += "; ";
  }
  if (!hasEnds && !isThere()) return std::nullopt;
  if (Problem wrong = begin()) return wrong;
  return executeAsAWhole(sql);
}

}  // namespace kyt
