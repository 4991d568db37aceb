#include "platform/linux/outbox/SQLitePostStore.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdio>
#include <utility>

#include "platform/linux/base/Descriptors.h"
#include "platform/linux/files/Files.h"
#include "platform/linux/outbox/PostRecord.h"

namespace kyt {
namespace {

using Kind = PostStoreProblem::Kind;

// A note of this file alone: its pages that hold nothing are overwritten.
constexpr char kIsClean[] = "SELECT value FROM notes WHERE name = 3";
constexpr off_t kWorthGivingBack = 1 << 20;  // bytes
// Rows that the disk does not let be deleted in one change; more are no matter of the rows.
constexpr unsigned kMostStuck = 16;
// Changes that fail, one after the other, at places of the file, although the disk takes another: no more are to be had of it.
constexpr unsigned kMostFailedChanges = 10;

}  // namespace

SQLitePostStore::SQLitePostStore(std::string folder, const char* library, Aside aside)
    : file_(std::move(folder) + "/outbox.sqlite"), libraryName_(library), aside_(aside) {}

SQLitePostStore::~SQLitePostStore() {
  SQLitePostStore::close();
}

void SQLitePostStore::close() {
  if (database_ == nullptr) return;
  for (sqlite3_stmt** statement : {&insert_, &delete_, &select_, &mark_})
    sqlite_->finalize(std::exchange(*statement, nullptr));
  sqlite_->close(std::exchange(database_, nullptr));
  gone_.clear();
  latest_.clear();
  failedChanges_ = 0;
}

PostStoreProblem SQLitePostStore::problem(int code, const char* what) const {
  const int kind = code & 0xFF;
  const char* text = database_ != nullptr ? sqlite_->errorText(database_) : sqlite_->textOfCode(code);
  const bool isDamaged =
      kind == SQLITE_NOTADB || kind == SQLITE_FORMAT || (kind == SQLITE_CORRUPT && diskGivesFile());
  return {isDamaged ? Kind::damaged : Kind::unavailable, std::string(what) + ": " + text};
}

// SQLite takes what a disk does not give for what is damaged.
bool SQLitePostStore::diskGivesFile() const {
  constexpr size_t kPiece = 65536;
  const Descriptor file = ownDescriptor(::open(file_.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
  std::vector<char> bytes(kPiece);
  ssize_t read = 1;
  for (off_t at = 0; read > 0; at += read) read = ::pread(file.get(), bytes.data(), bytes.size(), at);
  return read == 0;
}

bool SQLitePostStore::diskTakesAnother() const {
  const std::string other = file_ + ".new";
  const Descriptor file =
      ownDescriptor(::open(other.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600));
  const std::array<char, 4096> bytes{};
  const bool takes = ::write(file.get(), bytes.data(), bytes.size()) == static_cast<ssize_t>(bytes.size()) &&
                     ::fsync(file.get()) == 0;
  static_cast<void>(::unlink(other.c_str()));
  return takes;
}

SQLitePostStore::Problem SQLitePostStore::execute(const char* sql) {
  const int code = sqlite_->execute(database_, sql, nullptr, nullptr, nullptr);
  if (code == SQLITE_OK) return std::nullopt;
  return problem(code, file_.c_str());
}

SQLitePostStore::Problem SQLitePostStore::prepare(sqlite3_stmt*& statement, const char* sql) {
  const int code = sqlite_->prepare(database_, sql, -1, &statement, nullptr);
  if (code == SQLITE_OK) return std::nullopt;
  Problem wrong = problem(code, file_.c_str());
  if ((code & 0xFF) == SQLITE_ERROR) wrong->kind = Kind::damaged;  // its tables are not those of its version
  return wrong;
}

bool SQLitePostStore::isOfAPlace(int code) {
  return (code & 0xFF) == SQLITE_IOERR || (code & 0xFF) == SQLITE_CORRUPT;
}

std::string_view SQLitePostStore::blob(sqlite3_stmt* statement, int column) const {
  const void* bytes = sqlite_->columnBlob(statement, column);
  if (bytes == nullptr) return {};
  return {static_cast<const char*>(bytes), static_cast<size_t>(sqlite_->columnBytes(statement, column))};
}

SQLitePostStore::Problem SQLitePostStore::run(sqlite3_stmt* statement) {
  const int code = sqlite_->step(statement);
  Problem wrong;
  if (code != SQLITE_DONE) wrong = problem(code, file_.c_str());
  sqlite_->reset(statement);
  sqlite_->clearBindings(statement);
  return wrong;
}

SQLitePostStore::Problem SQLitePostStore::add(const StoredPost& post) {
  const std::string record = postRecord(post);
  const std::string_view body = post.body.view();
  sqlite_->bindInteger(insert_, 1, post.number);
  sqlite_->bindInteger(insert_, 2, static_cast<int64_t>(postChecksum(record, body)));
  sqlite_->bindBlob(insert_, 3, record.data(), record.size(), SQLITE_STATIC);
  sqlite_->bindBlob(insert_, 4, body.data() != nullptr ? body.data() : "", body.size(), SQLITE_STATIC);
  sqlite_->bindInteger(insert_, 5, static_cast<int64_t>(postHeadChecksum(post.number, record)));
  return run(insert_);
}

// A row whose pages the disk does not give cannot be deleted: it is noted as gone.
SQLitePostStore::Problem SQLitePostStore::remove(int64_t number) {
  sqlite3_stmt* statement = gone_.contains(number) ? mark_ : delete_;
  sqlite_->bindInteger(statement, 1, number);
  const int code = sqlite_->step(statement);
  Problem wrong;
  if (code != SQLITE_DONE) wrong = problem(code, file_.c_str());
  if (isOfAPlace(code) && statement == delete_) stuck_ = number;
  sqlite_->reset(statement);
  sqlite_->clearBindings(statement);
  return wrong;
}

SQLitePostStore::Problem SQLitePostStore::makeChange(std::span<const StoredPost* const> added,
                                                     std::span<const int64_t> removed, bool forGood) {
  if (Problem wrong = execute("BEGIN IMMEDIATE")) return wrong;
  for (const int64_t number : removed)
    if (Problem wrong = remove(number)) return wrong;
  if (!removed.empty() && !forGood)
    if (Problem wrong = execute("DELETE FROM notes WHERE name = 3")) return wrong;
  for (const StoredPost* post : added)
    if (Problem wrong = add(*post)) return wrong;
  return execute("COMMIT");
}

std::optional<PostStoreProblem> SQLitePostStore::change(std::span<const StoredPost* const> added,
                                                        std::span<const int64_t> removed, bool forGood) {
  if (added.empty() && removed.empty() && !isThere()) return std::nullopt;
  if (Problem wrong = begin()) return wrong;
  if (forGood)
    if (Problem wrong = execute("PRAGMA secure_delete=ON")) return wrong;
  Problem wrong;
  std::vector<int64_t> stuck;
  do {
    stuck_.reset();
    wrong = makeChange(added, removed, forGood);
    if (wrong && sqlite_->isAutoCommit(database_) == 0)
      static_cast<void>(sqlite_->execute(database_, "ROLLBACK", nullptr, nullptr, nullptr));
    if (wrong && stuck_) stuck.push_back(*stuck_);
    if (wrong && stuck_) gone_.insert(*stuck_);
  } while (wrong && stuck_ && stuck.size() <= kMostStuck);
  if (wrong)
    for (const int64_t number : stuck) gone_.erase(number);  // not noted
  failedChanges_ = wrong ? failedChanges_ + 1 : 0;
  if (failedChanges_ >= kMostFailedChanges && diskTakesAnother() && !diskGivesFile())
    wrong->kind = Kind::damaged;
  if (forGood) {
    // The log still has what was there.
    static_cast<void>(execute("PRAGMA secure_delete=FAST"));
    if (!wrong) wrong = overwriteFree();
  }
  return wrong;
}

std::variant<StoredPost, PostStoreProblem> SQLitePostStore::read(int64_t number) {
  if (Problem wrong = begin()) return std::move(*wrong);
  if (gone_.contains(number)) return PostStoreProblem{Kind::post, file_ + ": a post is missing"};
  sqlite_->bindInteger(select_, 1, number);
  const int code = sqlite_->step(select_);
  std::variant<StoredPost, PostStoreProblem> result;
  if (code == SQLITE_ROW) {
    const std::string_view record = blob(select_, 1), body = blob(select_, 2);
    auto post = readPostRecord(record);
    const bool isWhole =
        post && postChecksum(record, body) == static_cast<uint64_t>(sqlite_->columnInteger(select_, 0));
    if (isWhole) {
      post->number = number;
      post->body = Data(body);
      result = std::move(*post);
    } else {
      result = PostStoreProblem{Kind::post, file_ + ": a post is not what was kept"};
    }
  } else if (code == SQLITE_DONE) {
    result = PostStoreProblem{Kind::post, file_ + ": a post is missing"};
  } else {
    PostStoreProblem wrong = problem(code, file_.c_str());
    wrong.kind = Kind::unavailable;  // that is not said of the others
    result = std::move(wrong);
  }
  sqlite_->reset(select_);
  sqlite_->clearBindings(select_);
  return result;
}

bool SQLitePostStore::isThere() const {
  return ::access(file_.c_str(), F_OK) == 0;
}

// What was removed before lies in pages that hold nothing now. Rows of zeros take them all, and are removed again.
SQLitePostStore::Problem SQLitePostStore::overwriteFree() {
  // A row of so many bytes more than its pages hold fills each of them to its end.
  constexpr int64_t kMostPages = 1024, kBytesOfAPage = 508, kInTheTable = 40;
  std::optional<int64_t> posts, free, isClean;
  if (Problem wrong = query("SELECT 1 FROM posts LIMIT 1", posts)) return wrong;
  if (!posts) {
    removeFile();
    return std::nullopt;
  }
  if (Problem wrong = query(kIsClean, isClean)) return wrong;
  if (isClean) return execute("PRAGMA wal_checkpoint(TRUNCATE)");
  for (;;) {
    if (Problem wrong = query("PRAGMA freelist_count", free)) return wrong;
    if (free.value_or(0) == 0) break;
    const std::string bytes = std::to_string(std::min(*free, kMostPages) * kBytesOfAPage + kInTheTable);
    if (Problem wrong = execute(("INSERT INTO filler VALUES (NULL, zeroblob(" + bytes + "))").c_str()))
      return wrong;
  }
  if (Problem wrong =
          execute("BEGIN IMMEDIATE; DELETE FROM filler; INSERT OR REPLACE INTO notes VALUES (3, 1);"
                  "COMMIT"))
    return wrong;
  return execute("PRAGMA wal_checkpoint(TRUNCATE)");
}

void SQLitePostStore::becameEmpty() {
  struct stat status {};
  if (::stat(file_.c_str(), &status) != 0) return;
  if (status.st_size < kWorthGivingBack && gone_.empty()) return;
  removeFile();
}

void SQLitePostStore::removeFile() {
  close();
  static_cast<void>(::unlink(file_.c_str()));
  static_cast<void>(::unlink((file_ + "-wal").c_str()));
}

}  // namespace kyt
