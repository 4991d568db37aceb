// Posts in one file of SQLite, "outbox.sqlite", readable by the process's user alone: the outbox's, and a receiver's spool.
// A write-ahead log, and each change on the disk before it returns (synchronous=FULL). The process has the file for itself,
// so SQLite needs no file of shared memory. Empty and larger than a MiB it is removed.
//
// The file is made under another name and renamed when it is whole, so that an empty one has lost what was in it. It names
// the version of its tables twice (user_version, application_id). One of a later version is left alone: the store is
// unavailable then. What does not fit is damaged. Of a file whose disk fails at some pages the other rows are found, and a
// row that cannot be deleted is noted as gone (table "gone"). Each row has a checksum of what is known of it before its
// body is read, and one of all. A log of which frames are damaged that were whole once is seen as well.
#pragma once

#include <map>
#include <optional>
#include <set>
#include <span>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "platform/PostStore.h"
#include "platform/linux/outbox/SQLiteLibrary.h"

namespace kyt {

class SQLitePostStore final : public PostStore {
 public:
  static constexpr int kVersion = 3;
  // What setAside() does. Last: the file is "outbox.sqlite.damaged", in place of the one before, and its log is gone. Each: with
  // its log, which has what was kept last, beside those before ("outbox.sqlite.damaged.2" and so on); no byte of them is lost.
  enum class Aside { last, each };
  // The folder is there, and the process may write to it. `library`: for tests.
  explicit SQLitePostStore(std::string folder, const char* library = "libsqlite3.so.0",
                           Aside aside = Aside::last);
  ~SQLitePostStore() override;
  SQLitePostStore(const SQLitePostStore&) = delete;
  SQLitePostStore& operator=(const SQLitePostStore&) = delete;

  [[nodiscard]] std::optional<PostStoreProblem> open(Function<void(StoredPostHead)> found) override;
  [[nodiscard]] std::optional<PostStoreProblem> change(std::span<const StoredPost* const> added,
                                                       std::span<const int64_t> removed,
                                                       bool forGood) override;
  [[nodiscard]] std::variant<StoredPost, PostStoreProblem> read(int64_t number) override;
  [[nodiscard]] std::optional<PostStoreProblem> setLatest(int64_t number, int64_t time) override;
  [[nodiscard]] int64_t note(Note name) override;
  [[nodiscard]] std::optional<PostStoreProblem> setNote(Note name, int64_t value) override;
  [[nodiscard]] std::vector<ServerPause> pauses() override;
  [[nodiscard]] std::optional<PostStoreProblem> setPauses(std::span<const ServerPause> pauses) override;
  void becameEmpty() override;
  [[nodiscard]] std::string setAside() override;
  [[nodiscard]] uint64_t filesAside() const override;
  [[nodiscard]] bool removeSetAside(int64_t before) override;
  void close() override;

  [[nodiscard]] const std::string& file() const { return file_; }

 private:
  using Problem = std::optional<PostStoreProblem>;
  [[nodiscard]] std::string setAsideWithLog();
  [[nodiscard]] std::string freeAside() const;  // a name that nothing has yet
  [[nodiscard]] bool removeStrayLog() const;    // puts it beside, where each is kept
  [[nodiscard]] Problem begin();                // opens the file, and makes it
  [[nodiscard]] Problem makeFile();
  [[nodiscard]] Problem openFile();
  [[nodiscard]] Problem checkHeader(int descriptor) const;
  [[nodiscard]] Problem prepareFile();
  [[nodiscard]] Problem checkVersion();
  [[nodiscard]] Problem takeUp(const char* change);  // a file of an earlier version
  [[nodiscard]] Problem readGone();
  [[nodiscard]] Problem readLatest();
  [[nodiscard]] int64_t timeOf(int64_t number, int64_t keptAt) const;
  // All pages that hold nothing are overwritten, or the whole file is gone where no post is left.
  [[nodiscard]] Problem overwriteFree();
  void removeFile();
  // The first column of its first row; none: there is no row, or null in it.
  [[nodiscard]] Problem query(const char* sql, std::optional<int64_t>& value, int column = 0,
                              std::optional<int64_t> parameter = std::nullopt);
  // From the post after that on; `after` goes along.
  [[nodiscard]] Problem scan(int64_t& after, Function<void(StoredPostHead)>& found, bool& isOfOnePlace);
  [[nodiscard]] StoredPostHead headOf(sqlite3_stmt* row);
  // Past what the disk does not give, to the post before the next one that can be read.
  [[nodiscard]] Problem skipUnreadable(int64_t& after, Function<void(StoredPostHead)>& found);
  [[nodiscard]] Problem execute(const char* sql);
  [[nodiscard]] Problem executeAsAWhole(const std::string& sql);
  [[nodiscard]] Problem prepare(sqlite3_stmt*& statement, const char* sql);
  [[nodiscard]] Problem add(const StoredPost& post);
  [[nodiscard]] Problem remove(int64_t number);
  [[nodiscard]] Problem makeChange(std::span<const StoredPost* const> added, std::span<const int64_t> removed,
                                   bool forGood);
  [[nodiscard]] bool isThere() const;
  [[nodiscard]] Problem run(sqlite3_stmt* statement);
  // It failed at one page, others may be well.
  [[nodiscard]] static bool isOfAPlace(int code);
  [[nodiscard]] bool diskGivesFile() const;
  [[nodiscard]] bool diskTakesAnother() const;
  [[nodiscard]] PostStoreProblem problem(int code, const char* what) const;
  [[nodiscard]] std::string_view blob(sqlite3_stmt* statement, int column) const;

  const std::string file_;
  const char* const libraryName_;
  const Aside aside_;
  std::optional<SQLiteLibrary> sqlite_;
  sqlite3* database_ = nullptr;
  sqlite3_stmt *insert_ = nullptr, *delete_ = nullptr, *select_ = nullptr, *mark_ = nullptr;
  std::set<int64_t> gone_;             // rows that could not be deleted
  std::map<int64_t, int64_t> latest_;  // setLatest()
  std::optional<int64_t> stuck_;       // the one that the last change could not delete
  bool isLogDamaged_ = false;
  unsigned failedChanges_ = 0;  // in a row
};

}  // namespace kyt
