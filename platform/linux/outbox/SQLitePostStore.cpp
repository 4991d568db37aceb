#include "platform/linux/outbox/SQLitePostStore.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <utility>

#include "platform/linux/base/Descriptors.h"
#include "platform/linux/files/Files.h"
#include "platform/linux/outbox/PostRecord.h"

namespace kyt {
namespace {

using Kind = PostStoreProblem::Kind;

constexpr mode_t kMode = 0600;
constexpr char kAside[] = ".damaged";
constexpr off_t kWorthGivingBack = 1 << 20;  // bytes

// Small pages, since each that holds a byte of a post is written twice, to the log and to the file.
constexpr char kBeginning[] =
    "PRAGMA page_size=512; PRAGMA locking_mode=EXCLUSIVE; PRAGMA journal_mode=WAL; PRAGMA synchronous=FULL;"
    "PRAGMA temp_store=MEMORY; PRAGMA cache_size=-256; PRAGMA wal_autocheckpoint=2048;"
    "PRAGMA journal_size_limit=2097152; PRAGMA secure_delete=FAST; PRAGMA trusted_schema=OFF;";
constexpr char kTable[] =
    "BEGIN IMMEDIATE; CREATE TABLE IF NOT EXISTS posts (number INTEGER PRIMARY KEY, checksum INTEGER NOT NULL,"
    " record BLOB NOT NULL, body BLOB NOT NULL); PRAGMA user_version=1; COMMIT;";

}  // namespace

SQLitePostStore::SQLitePostStore(std::string folder, const char* library)
    : file_(std::move(folder) + "/outbox.sqlite"), libraryName_(library) {}

SQLitePostStore::~SQLitePostStore() {
  SQLitePostStore::close();
}

void SQLitePostStore::close() {
  if (database_ == nullptr) return;
  for (sqlite3_stmt** statement : {&insert_, &delete_, &select_})
    sqlite_->finalize(std::exchange(*statement, nullptr));
  sqlite_->close(std::exchange(database_, nullptr));
}

PostStoreProblem SQLitePostStore::problem(int code, const char* what) const {
  const int kind = code & 0xFF;
  const char* text = database_ != nullptr ? sqlite_->errorText(database_) : sqlite_->textOfCode(code);
  const bool isDamaged = kind == SQLITE_CORRUPT || kind == SQLITE_NOTADB;
  return {isDamaged ? Kind::damaged : Kind::unavailable, std::string(what) + ": " + text};
}

SQLitePostStore::Problem SQLitePostStore::execute(const char* sql) {
  const int code = sqlite_->execute(database_, sql, nullptr, nullptr, nullptr);
  if (code == SQLITE_OK) return std::nullopt;
  return problem(code, file_.c_str());
}

SQLitePostStore::Problem SQLitePostStore::prepare(sqlite3_stmt*& statement, const char* sql) {
  const int code = sqlite_->prepare(database_, sql, -1, &statement, nullptr);
  if (code == SQLITE_OK) return std::nullopt;
  return problem(code, file_.c_str());
}

std::string_view SQLitePostStore::blob(sqlite3_stmt* statement, int column) const {
  const void* bytes = sqlite_->columnBlob(statement, column);
  if (bytes == nullptr) return {};
  return {static_cast<const char*>(bytes), static_cast<size_t>(sqlite_->columnBytes(statement, column))};
}

SQLitePostStore::Problem SQLitePostStore::begin() {
  if (database_ != nullptr) return std::nullopt;
  if (!sqlite_) {
    auto loaded = SQLiteLibrary::load(libraryName_);
    if (auto* text = std::get_if<std::string>(&loaded))
      return PostStoreProblem{Kind::unavailable, std::move(*text)};
    sqlite_ = std::get<SQLiteLibrary>(loaded);
  }
  Problem wrong = openFile();
  if (!wrong) wrong = prepareFile();
  if (wrong) close();
  return wrong;
}

SQLitePostStore::Problem SQLitePostStore::openFile() {
  // Made here for its mode, which SQLite gives its log too.
  const Descriptor made =
      ownDescriptor(::open(file_.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, kMode));
  if (made.get() < 0) return PostStoreProblem{Kind::unavailable, file_ + ": " + errorText(errno)};
  struct stat status {};
  const bool isOurs = ::fstat(made.get(), &status) == 0 && S_ISREG(status.st_mode);
  if (!isOurs) return PostStoreProblem{Kind::unavailable, file_ + ": is no regular file"};
  if ((status.st_mode & 07777) != kMode && ::fchmod(made.get(), kMode) != 0)
    return PostStoreProblem{Kind::unavailable, file_ + ": " + errorText(errno)};
  const int code =
      sqlite_->open(file_.c_str(), &database_, SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX, nullptr);
  if (code == SQLITE_OK) return std::nullopt;
  return problem(code, file_.c_str());
}

SQLitePostStore::Problem SQLitePostStore::prepareFile() {
  if (Problem wrong = execute(kBeginning)) return wrong;
  sqlite3_stmt* version = nullptr;
  if (Problem wrong = prepare(version, "PRAGMA user_version")) return wrong;
  const int code = sqlite_->step(version);
  const auto number = code == SQLITE_ROW ? sqlite_->columnInteger(version, 0) : int64_t{0};
  sqlite_->finalize(version);
  if (code != SQLITE_ROW) return problem(code, file_.c_str());
  if (number > kVersion)
    return PostStoreProblem{Kind::unavailable, file_ + ": was written by a later version of the daemon"};
  if (number < kVersion)
    if (Problem wrong = execute(kTable)) return wrong;
  if (Problem wrong = prepare(insert_, "INSERT INTO posts VALUES (?, ?, ?, ?)")) return wrong;
  if (Problem wrong = prepare(delete_, "DELETE FROM posts WHERE number = ?")) return wrong;
  return prepare(select_, "SELECT checksum, record, body FROM posts WHERE number = ?");
}

std::optional<PostStoreProblem> SQLitePostStore::open(Function<void(StoredPostHead)> found) {
  if (::access(file_.c_str(), F_OK) != 0) {
    if (errno == ENOENT) return std::nullopt;
    return PostStoreProblem{Kind::unavailable, file_ + ": " + errorText(errno)};
  }
  if (Problem wrong = begin()) return wrong;
  sqlite3_stmt* all = nullptr;
  if (Problem wrong = prepare(all, "SELECT number, record, length(body) FROM posts ORDER BY number"))
    return wrong;
  int code = SQLITE_ROW;
  bool isWhole = true;
  while (isWhole && (code = sqlite_->step(all)) == SQLITE_ROW) {
    auto post = readPostRecord(blob(all, 1));
    isWhole = post.has_value();
    if (!isWhole) break;
    post->number = sqlite_->columnInteger(all, 0);
    const uint64_t bytes = PostStore::bytesOf(*post) + static_cast<uint64_t>(sqlite_->columnInteger(all, 2));
    post->headers.clear();
    found(StoredPostHead{std::move(*post), bytes});
  }
  Problem wrong;
  if (!isWhole)
    wrong = PostStoreProblem{Kind::damaged, file_ + ": a row is no post"};
  else if (code != SQLITE_DONE)
    wrong = problem(code, file_.c_str());
  sqlite_->finalize(all);
  return wrong;
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
  return run(insert_);
}

SQLitePostStore::Problem SQLitePostStore::remove(int64_t number) {
  sqlite_->bindInteger(delete_, 1, number);
  return run(delete_);
}

SQLitePostStore::Problem SQLitePostStore::makeChange(std::span<const StoredPost* const> added,
                                                     std::span<const int64_t> removed) {
  if (Problem wrong = execute("BEGIN IMMEDIATE")) return wrong;
  for (const int64_t number : removed)
    if (Problem wrong = remove(number)) return wrong;
  for (const StoredPost* post : added)
    if (Problem wrong = add(*post)) return wrong;
  return execute("COMMIT");
}

std::optional<PostStoreProblem> SQLitePostStore::change(std::span<const StoredPost* const> added,
                                                        std::span<const int64_t> removed, bool forGood) {
  if (Problem wrong = begin()) return wrong;
  if (forGood)
    if (Problem wrong = execute("PRAGMA secure_delete=ON")) return wrong;
  Problem wrong = makeChange(added, removed);
  if (wrong && sqlite_->isAutoCommit(database_) == 0)
    static_cast<void>(sqlite_->execute(database_, "ROLLBACK", nullptr, nullptr, nullptr));
  if (forGood) {
    // The log still has what was there.
    static_cast<void>(execute("PRAGMA secure_delete=FAST"));
    if (!wrong) wrong = execute("PRAGMA wal_checkpoint(TRUNCATE)");
  }
  return wrong;
}

std::variant<StoredPost, PostStoreProblem> SQLitePostStore::read(int64_t number) {
  if (Problem wrong = begin()) return std::move(*wrong);
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
    result = problem(code, file_.c_str());
  }
  sqlite_->reset(select_);
  sqlite_->clearBindings(select_);
  return result;
}

void SQLitePostStore::becameEmpty() {
  struct stat status {};
  if (::stat(file_.c_str(), &status) != 0 || status.st_size < kWorthGivingBack) return;
  close();
  static_cast<void>(::unlink(file_.c_str()));
  static_cast<void>(::unlink((file_ + "-wal").c_str()));
}

void SQLitePostStore::removeSetAside() {
  static_cast<void>(::unlink((file_ + kAside).c_str()));
}

std::string SQLitePostStore::setAside() {
  close();
  const std::string aside = file_ + kAside;
  static_cast<void>(::unlink((file_ + "-wal").c_str()));
  if (std::rename(file_.c_str(), aside.c_str()) == 0) return "it is " + aside + " now";
  const std::string why = errorText(errno);
  if (::unlink(file_.c_str()) == 0) return "it is removed, since it cannot be renamed: " + why;
  return "it can be neither renamed nor removed: " + why;
}

}  // namespace kyt
