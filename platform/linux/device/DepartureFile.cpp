#include "platform/linux/device/DepartureFile.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <set>
#include <thread>
#include <utility>
#include <variant>

#include "platform/base/Blocking.h"

namespace kyt {

namespace {

std::string lockIn(const std::string& folder) {
  return folder + "/daemon.lock";
}

struct flock wholeFile() {
  struct flock lock = {};
  lock.l_type = F_WRLCK;
  lock.l_whence = SEEK_SET;
  return lock;
}

constexpr std::chrono::milliseconds kPause{5};

// Made by root, it must still be the daemon's to open.
Descriptor openOrMake(const std::string& path) {
  Descriptor file = ownDescriptor(::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0640));
  if (!file) return file;
  struct stat above = {}, own = {};
  const std::string folder = path.substr(0, path.rfind('/'));
  if (::stat(folder.c_str(), &above) == 0 && ::fstat(file.get(), &own) == 0 && own.st_uid != above.st_uid &&
      ::fchown(file.get(), above.st_uid, above.st_gid) != 0)
    errno = 0;
  return file;
}

// False: errno says why, EAGAIN or EACCES where another process has locked it.
bool lockWhole(const Descriptor& file) {
  struct flock lock = wholeFile();
  return ::fcntl(file.get(), F_SETLK, &lock) == 0;
}

bool isAt(const Descriptor& file, const std::string& path) {
  struct stat own = {}, there = {};
  return ::fstat(file.get(), &own) == 0 && ::stat(path.c_str(), &there) == 0 && own.st_dev == there.st_dev &&
         own.st_ino == there.st_ino;
}

std::string problemWith(const std::string& path) {
  return path + ": " + errorText(errno);
}

}  // namespace

std::optional<DaemonLock> DaemonLock::take(const std::string& folder, Duration patience, std::string& problem,
                                           const std::function<bool()>& meanwhile) {
  const std::string path = lockIn(folder);
  Descriptor file = openOrMake(path);
  if (!file) {
    problem = problemWith(path);
    return std::nullopt;
  }
  const MonotonicTime end = std::chrono::steady_clock::now() + patience;
  while (!lockWhole(file)) {
    const bool isKept = errno == EAGAIN || errno == EACCES;
    if (!isKept || std::chrono::steady_clock::now() >= end || (meanwhile && !meanwhile())) {
      problem = problemWith(path);
      return std::nullopt;
    }
    std::this_thread::sleep_for(kPause);
  }
  return DaemonLock(std::move(file));
}

std::optional<DaemonLock> DaemonLock::take(const std::string& folder, Duration patience,
                                           std::string& problem) {
  return take(folder, patience, problem, nullptr);
}

std::optional<DaemonLock> DaemonLock::takeFromDaemon(const std::string& folder, Duration patience,
                                                     std::string& problem, int& told) {
  std::set<pid_t> asked;
  return take(folder, patience, problem, [&] {
    const pid_t keeper = holder(folder);
    if (keeper <= 0 || !asked.insert(keeper).second) return true;
    if (::kill(keeper, SIGTERM) == 0)
      ++told;
    else if (errno != ESRCH)
      return false;
    return true;
  });
}

pid_t DaemonLock::holder(const std::string& folder) {
  const Descriptor file = ownDescriptor(::open(lockIn(folder).c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
  if (!file) return 0;
  struct flock lock = wholeFile();
  if (::fcntl(file.get(), F_GETLK, &lock) != 0 || lock.l_type == F_UNLCK) return 0;
  return lock.l_pid > 0 ? lock.l_pid : 0;
}

bool ErasureMark::isHeld() const {
  const Descriptor file = ownDescriptor(::open(path_.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
  struct flock lock = wholeFile();
  return file && ::fcntl(file.get(), F_GETLK, &lock) == 0 && lock.l_type != F_UNLCK;
}

// What was locked may have been removed before: then it is nobody's mark.
bool ErasureMark::set() {
  while (!file_) {
    Descriptor file = openOrMake(path_);
    if (!file) return false;
    if (!lockWhole(file)) {
      if (errno != EAGAIN && errno != EACCES) return false;
      std::this_thread::sleep_for(kPause);
      continue;
    }
    if (!isAt(file, path_)) continue;
    file_ = std::move(file);
  }
  return true;
}

bool ErasureMark::remove() {
  Descriptor file = std::move(file_);
  if (!file) {
    file = ownDescriptor(::open(path_.c_str(), O_RDWR | O_CLOEXEC | O_NOFOLLOW));
    if (!file) return errno == ENOENT;
    if (!lockWhole(file)) return false;
    if (!isAt(file, path_)) return true;
  }
  return ::unlink(path_.c_str()) == 0 || errno == ENOENT;
}

DepartureTable DepartureFile::read(const std::string& folder, JSON& json) {
  const auto contents = readRegularFile(pathIn(folder), kMostBytes);
  const auto* file = std::get_if<FileContents>(&contents);
  if (file == nullptr) return DepartureTable();
  const auto parsed = json.parse(file->bytes);
  const auto* object = std::get_if<Value>(&parsed);
  return object != nullptr ? DepartureTable::of(*object) : DepartureTable();
}

DepartureFile::DepartureFile(std::string folder, JSON& json, Log& log, const Clock& clock,
                             TimerService& timers, std::shared_ptr<SerialQueue> queue)
    : folder_(std::move(folder)),
      path_(pathIn(folder_)),
      json_(json),
      log_(log),
      clock_(clock),
      timers_(timers),
      queue_(std::move(queue)),
      table_(read(folder_, json)),
      identity_(identityOf(path_)) {
  if (table_.since() == 0) table_ = DepartureTable(clock_.timeOfDay().asSeconds());
}

DepartureFile::~DepartureFile() = default;

void DepartureFile::followFile() {
  if (!identity_.exists() || identityOf(path_) == identity_) return;
  identity_ = {};
  table_ = DepartureTable(clock_.timeOfDay().asSeconds());
  changed_ = false;
}

void DepartureFile::add(const Departure& departure) {
  MutexLock lock(mutex_);
  followFile();
  table_.add(departure, clock_.timeOfDay().asSeconds());
  changed_ = true;
  if (!timer_) timer_ = timers_.after(kWrittenAfter, queue_, [this] { flush(); });
}

void DepartureFile::flush() {
  const BlockingScope blocking;
  MutexLock one(writing_);
  std::string text;
  {
    MutexLock lock(mutex_);
    timer_ = TimerHandle();
    followFile();
    if (!std::exchange(changed_, false)) return;
    table_.dropOld(clock_.timeOfDay().asSeconds());
    json_.writeCompact(table_.object(), text);
  }
  if (const auto problem = write(text)) log_.error("departures: %s", problem->c_str());
  MutexLock lock(mutex_);
  identity_ = identityOf(path_);
}

std::optional<std::string> DepartureFile::write(const std::string& text) {
  const std::string temporary = folder_ + "/.departures.json.new";
  if (::unlink(temporary.c_str()) != 0 && errno != ENOENT) return problemWith(temporary);
  const Descriptor out =
      ownDescriptor(::open(temporary.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600));
  if (!out) return problemWith(temporary);
  if (writeAll(out.get(), text) && ::fchmod(out.get(), 0640) == 0 && ::fsync(out.get()) == 0 &&
      ::rename(temporary.c_str(), path_.c_str()) == 0)
    return std::nullopt;
  std::string problem = problemWith(path_);
  ::unlink(temporary.c_str());
  return problem;
}

}  // namespace kyt
