// How the outbox's file is made, and checked at the start.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdio>
#include <utility>

#include "platform/linux/base/Descriptors.h"
#include "platform/linux/files/Files.h"
#include "platform/linux/outbox/SQLitePostStore.h"
#include "platform/linux/outbox/WriteAheadLog.h"

namespace kyt {
namespace {

using Kind = PostStoreProblem::Kind;

constexpr mode_t kMode = 0600;
constexpr int64_t kApplication = 0x4B595400;  // "KYT" and the version
constexpr int64_t kVersionBits = 0xFF, kSecondVersion = 2;
constexpr size_t kHeaderBytes = 100;

// Small pages, since each that holds a byte of a post is written twice, to the log and to the file.
constexpr char kBeginning[] =
    "PRAGMA page_size=512; PRAGMA locking_mode=EXCLUSIVE; PRAGMA journal_mode=WAL; PRAGMA synchronous=FULL;"
    "PRAGMA temp_store=MEMORY; PRAGMA cache_size=-256; PRAGMA wal_autocheckpoint=2048;"
    "PRAGMA journal_size_limit=2097152; PRAGMA secure_delete=FAST; PRAGMA trusted_schema=OFF;";
#define KYT_SINCE_THE_SECOND                                                                         \
  "CREATE TABLE gone (number INTEGER PRIMARY KEY); CREATE TABLE latest (number INTEGER PRIMARY KEY," \
  " time INTEGER NOT NULL); CREATE TABLE notes (name INTEGER PRIMARY KEY, value INTEGER NOT NULL);"  \
  "CREATE TABLE filler (number INTEGER PRIMARY KEY, bytes BLOB NOT NULL);"
#define KYT_SINCE_THE_THIRD                                                                \
  "CREATE TABLE IF NOT EXISTS pauses (server INTEGER PRIMARY KEY, since INTEGER NOT NULL," \
  " until INTEGER NOT NULL); PRAGMA user_version=3; PRAGMA application_id=1264145411; COMMIT;"
constexpr char kTables[] =
    "BEGIN IMMEDIATE; CREATE TABLE posts (number INTEGER PRIMARY KEY, checksum INTEGER NOT NULL,"
    " record BLOB NOT NULL, body BLOB NOT NULL, head INTEGER);" KYT_SINCE_THE_SECOND KYT_SINCE_THE_THIRD;
// Rows of the first version have no checksum of their head: the other one is looked at.
constexpr char kFromTheFirst[] =
    "BEGIN IMMEDIATE; ALTER TABLE posts ADD COLUMN head INTEGER;" KYT_SINCE_THE_SECOND KYT_SINCE_THE_THIRD;
constexpr char kFromTheSecond[] = "BEGIN IMMEDIATE;" KYT_SINCE_THE_THIRD;
#undef KYT_SINCE_THE_SECOND
#undef KYT_SINCE_THE_THIRD
static_assert((kApplication | SQLitePostStore::kVersion) == 1264145411);

}  // namespace

SQLitePostStore::Problem SQLitePostStore::begin() {
  if (database_ != nullptr) return std::nullopt;
  if (!sqlite_) {
    auto loaded = SQLiteLibrary::load(libraryName_);
    if (auto* text = std::get_if<std::string>(&loaded))
      return PostStoreProblem{Kind::unavailable, std::move(*text)};
    sqlite_ = std::get<SQLiteLibrary>(loaded);
  }
  Problem wrong;
  if (::access(file_.c_str(), F_OK) != 0 && errno == ENOENT) wrong = makeFile();
  if (!wrong) wrong = openFile();
  if (!wrong) wrong = prepareFile();
  if (wrong) close();
  return wrong;
}

// Under its name there is a whole one or none.
SQLitePostStore::Problem SQLitePostStore::makeFile() {
  const std::string made = file_ + ".new";
  const auto unlinkAll = [&made] {
    for (const char* end : {"", "-wal", "-journal"}) static_cast<void>(::unlink((made + end).c_str()));
  };
  struct stat link {};
  if (::lstat(file_.c_str(), &link) == 0)
    return PostStoreProblem{Kind::unavailable, file_ + ": is no regular file"};
  unlinkAll();
  if (!removeStrayLog()) return PostStoreProblem{Kind::unavailable, file_ + "-wal: " + errorText(errno)};
  // Made here for its mode, which SQLite gives its log too.
  if (ownDescriptor(::open(made.c_str(), O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW, kMode)).get() <
      0)
    return PostStoreProblem{Kind::unavailable, made + ": " + errorText(errno)};
  const int code =
      sqlite_->open(made.c_str(), &database_, SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX, nullptr);
  Problem wrong;
  if (code != SQLITE_OK) wrong = problem(code, made.c_str());
  if (!wrong) wrong = execute(kBeginning);
  if (!wrong) wrong = execute(kTables);
  close();
  if (!wrong && std::rename(made.c_str(), file_.c_str()) != 0)
    wrong = PostStoreProblem{Kind::unavailable, file_ + ": " + errorText(errno)};
  if (wrong) {
    wrong->kind = Kind::unavailable;
    unlinkAll();
    return wrong;
  }
  const Descriptor folder =
      ownDescriptor(::open(file_.substr(0, file_.rfind('/')).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (folder.get() < 0 || ::fsync(folder.get()) != 0)
    return PostStoreProblem{Kind::unavailable, file_ + ": " + errorText(errno)};
  return std::nullopt;
}

SQLitePostStore::Problem SQLitePostStore::openFile() {
  const Descriptor opened = ownDescriptor(::open(file_.c_str(), O_RDWR | O_CLOEXEC | O_NOFOLLOW));
  if (opened.get() < 0) return PostStoreProblem{Kind::unavailable, file_ + ": " + errorText(errno)};
  struct stat status {};
  const bool isOurs = ::fstat(opened.get(), &status) == 0 && S_ISREG(status.st_mode);
  if (!isOurs) return PostStoreProblem{Kind::unavailable, file_ + ": is no regular file"};
  if ((status.st_mode & 07777) != kMode && ::fchmod(opened.get(), kMode) != 0)
    return PostStoreProblem{Kind::unavailable, file_ + ": " + errorText(errno)};
  if (Problem wrong = checkHeader(opened.get())) return wrong;
  const int code =
      sqlite_->open(file_.c_str(), &database_, SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX, nullptr);
  if (code == SQLITE_OK) return std::nullopt;
  return problem(code, file_.c_str());
}

// What of it no change of the file ever changes, and of which SQLite would say no more than that the file cannot be written,
// or take it for a new one.
SQLitePostStore::Problem SQLitePostStore::checkHeader(int descriptor) const {
  std::array<char, kHeaderBytes> bytes{};
  const ssize_t size = ::pread(descriptor, bytes.data(), bytes.size(), 0);
  if (size < 0) return PostStoreProblem{Kind::unavailable, file_ + ": " + errorText(errno)};
  const std::string_view header(bytes.data(), static_cast<size_t>(size));
  const auto isVersion = [](char value) { return value == 1 || value == 2; };
  constexpr std::string_view kBegin("SQLite format 3\0\x02\x00", 18);
  if (header.size() == kHeaderBytes && header.substr(0, kBegin.size()) == kBegin && isVersion(header[18]) &&
      isVersion(header[19]))
    return std::nullopt;
  return PostStoreProblem{Kind::damaged, file_ + (size == 0 ? ": is empty" : ": its beginning is damaged")};
}

SQLitePostStore::Problem SQLitePostStore::query(const char* sql, std::optional<int64_t>& value, int column,
                                                std::optional<int64_t> parameter) {
  sqlite3_stmt* statement = nullptr;
  Problem wrong = prepare(statement, sql);
  if (wrong) return wrong;
  if (parameter) sqlite_->bindInteger(statement, 1, *parameter);
  value.reset();
  const int code = sqlite_->step(statement);
  if (code == SQLITE_ROW && sqlite_->columnType(statement, column) != SQLITE_NULL)
    value = sqlite_->columnInteger(statement, column);
  else if (code != SQLITE_ROW && code != SQLITE_DONE)
    wrong = problem(code, file_.c_str());
  sqlite_->finalize(statement);
  return wrong;
}

SQLitePostStore::Problem SQLitePostStore::prepareFile() {
  const uint64_t wholeFrames = lastWholeFrame(file_ + "-wal");
  if (Problem wrong = execute(kBeginning)) return wrong;
  std::optional<int64_t> frames;
  if (wholeFrames != 0)
    if (Problem wrong = query("PRAGMA wal_checkpoint(PASSIVE)", frames, 1)) return wrong;
  isLogDamaged_ = isLogDamaged_ || (frames && *frames >= 0 && static_cast<uint64_t>(*frames) < wholeFrames);
  if (Problem wrong = checkVersion()) return wrong;
  if (Problem wrong = prepare(insert_, "INSERT INTO posts VALUES (?, ?, ?, ?, ?)")) return wrong;
  if (Problem wrong = prepare(delete_, "DELETE FROM posts WHERE number = ?")) return wrong;
  if (Problem wrong = prepare(mark_, "INSERT OR IGNORE INTO gone VALUES (?)")) return wrong;
  if (Problem wrong = prepare(select_, "SELECT checksum, record, body FROM posts WHERE number = ?"))
    return wrong;
  if (Problem wrong = readGone()) return wrong;
  return readLatest();
}

// All of it or nothing, whenever the process is killed.
SQLitePostStore::Problem SQLitePostStore::takeUp(const char* change) {
  const int code = sqlite_->execute(database_, change, nullptr, nullptr, nullptr);
  if (code == SQLITE_OK) return std::nullopt;
  Problem wrong = problem(code, file_.c_str());
  if ((code & 0xFF) == SQLITE_ERROR) wrong->kind = Kind::damaged;  // its tables are not those of its version
  return wrong;
}

// It stands in the file twice, so that one that is damaged is not taken for a later one.
SQLitePostStore::Problem SQLitePostStore::checkVersion() {
  std::optional<int64_t> version, application;
  if (Problem wrong = query("PRAGMA user_version", version)) return wrong;
  if (Problem wrong = query("PRAGMA application_id", application)) return wrong;
  if (version == 1 && application == 0) return takeUp(kFromTheFirst);
  const bool isWhole = version && application && (*application & ~kVersionBits) == kApplication &&
                       (*application & kVersionBits) == *version && *version >= kSecondVersion;
  if (!isWhole) return PostStoreProblem{Kind::damaged, file_ + ": its version is damaged"};
  if (*version == kVersion) return std::nullopt;
  if (*version == kSecondVersion) return takeUp(kFromTheSecond);
  return PostStoreProblem{Kind::unavailable, file_ + ": was written by a later version of the daemon"};
}

SQLitePostStore::Problem SQLitePostStore::readGone() {
  sqlite3_stmt* all = nullptr;
  if (Problem wrong = prepare(all, "SELECT number FROM gone")) return wrong;
  int code = SQLITE_ROW;
  while ((code = sqlite_->step(all)) == SQLITE_ROW) gone_.insert(sqlite_->columnInteger(all, 0));
  Problem wrong;
  if (code != SQLITE_DONE) wrong = problem(code, file_.c_str());
  sqlite_->finalize(all);
  return wrong;
}

SQLitePostStore::Problem SQLitePostStore::readLatest() {
  sqlite3_stmt* all = nullptr;
  if (Problem wrong = prepare(all, "SELECT number, time FROM latest")) return wrong;
  int code = SQLITE_ROW;
  while ((code = sqlite_->step(all)) == SQLITE_ROW)
    latest_[sqlite_->columnInteger(all, 0)] = sqlite_->columnInteger(all, 1);
  Problem wrong;
  if (code != SQLITE_DONE) wrong = problem(code, file_.c_str());
  sqlite_->finalize(all);
  return wrong;
}

// A post's own time is that of a clock that may not have been set, or wrong.
int64_t SQLitePostStore::timeOf(int64_t number, int64_t keptAt) const {
  for (auto latest = latest_.lower_bound(number); latest != latest_.end(); ++latest)
    if (keptAt == 0 || latest->second < keptAt) keptAt = latest->second;
  return keptAt;
}

}  // namespace kyt
