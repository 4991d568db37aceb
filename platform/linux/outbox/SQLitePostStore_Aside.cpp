// What becomes of a file that is damaged.
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <filesystem>
#include <system_error>

#include "platform/linux/files/Files.h"
#include "platform/linux/outbox/SQLitePostStore.h"

namespace kyt {
namespace {

constexpr char kAside[] = ".damaged", kLog[] = "-wal";

bool isAnythingAt(const std::string& name) {
  struct stat status {};
  return ::lstat(name.c_str(), &status) == 0;
}

}  // namespace

bool SQLitePostStore::removeSetAside(int64_t before) {
  const std::string aside = file_ + kAside;
  struct stat status {};
  if (::lstat(aside.c_str(), &status) != 0) return errno == ENOENT;
  return status.st_mtime >= before || ::unlink(aside.c_str()) == 0;
}

std::string SQLitePostStore::setAside() {
  close();
  if (aside_ == Aside::each) return setAsideWithLog();
  const std::string aside = file_ + kAside;
  static_cast<void>(::unlink((file_ + "-wal").c_str()));
  if (std::rename(file_.c_str(), aside.c_str()) == 0) return "it is " + aside + " now";
  const std::string why = errorText(errno);
  if (::unlink(file_.c_str()) == 0) return "it is removed, since it cannot be renamed: " + why;
  return "it can be neither renamed nor removed: " + why;
}

// With the log of a file that is gone SQLite would put what was in that into the next one.
bool SQLitePostStore::removeStrayLog() const {
  const std::string log = file_ + kLog;
  if (!isAnythingAt(log)) return true;
  return aside_ == Aside::each ? std::rename(log.c_str(), (freeAside() + kLog).c_str()) == 0
                               : ::unlink(log.c_str()) == 0;
}

std::string SQLitePostStore::freeAside() const {
  std::string aside = file_ + kAside;
  for (unsigned i = 2; isAnythingAt(aside) || isAnythingAt(aside + kLog); ++i)
    aside = file_ + kAside + "." + std::to_string(i);
  return aside;
}

std::string SQLitePostStore::setAsideWithLog() {
  const std::string aside = freeAside();
  // The log goes first: a file that begins anew would take it for its own.
  const bool isLogMoved =
      !isAnythingAt(file_ + kLog) || std::rename((file_ + kLog).c_str(), (aside + kLog).c_str()) == 0;
  if (isLogMoved && std::rename(file_.c_str(), aside.c_str()) == 0) return "it is " + aside + " now";
  return "it cannot be renamed: " + errorText(errno);
}

uint64_t SQLitePostStore::filesAside() const {
  const size_t slash = file_.rfind('/');
  const std::string begin = file_.substr(slash + 1) + kAside;
  uint64_t files = 0;
  std::error_code error;
  for (std::filesystem::directory_iterator entry(file_.substr(0, slash), error), end; !error && entry != end;
       entry.increment(error)) {
    const std::string name = entry->path().filename();
    if (name.starts_with(begin) && !name.ends_with(kLog)) ++files;
  }
  return files;
}

}  // namespace kyt
