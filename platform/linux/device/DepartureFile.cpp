#include "platform/linux/device/DepartureFile.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
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

std::string problemWith(const std::string& path) {
  return path + ": " + errorText(errno);
}

}  // namespace

std::optional<DaemonLock> DaemonLock::take(const std::string& folder, Duration patience,
                                           std::string& problem) {
  const std::string path = lockIn(folder);
  Descriptor file = ownDescriptor(::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0640));
  if (!file) {
    problem = problemWith(path);
    return std::nullopt;
  }
  // Made by root, it must still be the daemon's to open.
  struct stat above = {}, own = {};
  if (::stat(folder.c_str(), &above) == 0 && ::fstat(file.get(), &own) == 0 && own.st_uid != above.st_uid &&
      ::fchown(file.get(), above.st_uid, above.st_gid) != 0)
    errno = 0;
  const MonotonicTime end = std::chrono::steady_clock::now() + patience;
  struct flock lock = wholeFile();
  while (::fcntl(file.get(), F_SETLK, &lock) != 0) {
    if ((errno != EAGAIN && errno != EACCES) || std::chrono::steady_clock::now() >= end) {
      problem = problemWith(path);
      return std::nullopt;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
  return DaemonLock(std::move(file));
}

pid_t DaemonLock::holder(const std::string& folder) {
  const Descriptor file = ownDescriptor(::open(lockIn(folder).c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
  if (!file) return 0;
  struct flock lock = wholeFile();
  if (::fcntl(file.get(), F_GETLK, &lock) != 0 || lock.l_type == F_UNLCK) return 0;
  return lock.l_pid > 0 ? lock.l_pid : 0;
}

bool ErasureMark::set() const {
  return ownDescriptor(::open(path_.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0640)).get() >= 0;
}

bool ErasureMark::remove() const {
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
