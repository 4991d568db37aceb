// The outbox's posts in one file of SQLite, "outbox.sqlite", readable by the daemon's user alone. A write-ahead log, and
// each change on the disk before it returns (synchronous=FULL). The daemon has the file for itself, so SQLite needs no
// file of shared memory. An empty outbox of more than a MiB has its file removed.
//
// The file names the version of its table. One of a later version is left alone: the store is unavailable then.
#pragma once

#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <variant>

#include "platform/PostStore.h"
#include "platform/linux/outbox/SQLiteLibrary.h"

namespace kyt {

class SQLitePostStore final : public PostStore {
 public:
  static constexpr int kVersion = 1;
  // The folder is there, and the daemon may write to it. `library`: for tests.
  explicit SQLitePostStore(std::string folder, const char* library = "libsqlite3.so.0");
  ~SQLitePostStore() override;
  SQLitePostStore(const SQLitePostStore&) = delete;
  SQLitePostStore& operator=(const SQLitePostStore&) = delete;

  [[nodiscard]] std::optional<PostStoreProblem> open(Function<void(StoredPostHead)> found) override;
  [[nodiscard]] std::optional<PostStoreProblem> change(std::span<const StoredPost* const> added,
                                                       std::span<const int64_t> removed,
                                                       bool forGood) override;
  [[nodiscard]] std::variant<StoredPost, PostStoreProblem> read(int64_t number) override;
  void becameEmpty() override;
  [[nodiscard]] std::string setAside() override;
  void removeSetAside() override;
  void close() override;

  [[nodiscard]] const std::string& file() const { return file_; }

 private:
  using Problem = std::optional<PostStoreProblem>;
  [[nodiscard]] Problem begin();  // opens the file, and makes it
  [[nodiscard]] Problem openFile();
  [[nodiscard]] Problem prepareFile();
  [[nodiscard]] Problem execute(const char* sql);
  [[nodiscard]] Problem prepare(sqlite3_stmt*& statement, const char* sql);
  [[nodiscard]] Problem add(const StoredPost& post);
  [[nodiscard]] Problem remove(int64_t number);
  [[nodiscard]] Problem makeChange(std::span<const StoredPost* const> added,
                                   std::span<const int64_t> removed);
  [[nodiscard]] Problem run(sqlite3_stmt* statement);
  [[nodiscard]] PostStoreProblem problem(int code, const char* what) const;
  [[nodiscard]] std::string_view blob(sqlite3_stmt* statement, int column) const;

  const std::string file_;
  const char* const libraryName_;
  std::optional<SQLiteLibrary> sqlite_;
  sqlite3* database_ = nullptr;
  sqlite3_stmt *insert_ = nullptr, *delete_ = nullptr, *select_ = nullptr;
};

}  // namespace kyt
