// What left in the last day as a file of the daemon's (docs/OWNERS.md), and the lock by which the daemon and those who erase
// it exclude each other.
//
// The file is written half a minute after something left, once, so a daemon from which nothing leaves writes nothing; and at
// the orderly end. A daemon that is killed loses what left in that time. It is replaced by renaming a complete, synced one
// over it; mode 0640, owner and group of the folder. A file that somebody else removed or replaced is the truth: what this
// object knew is forgotten, and never written again.
#pragma once

#include <sys/types.h>

#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/JSON.h"
#include "platform/base/Clock.h"
#include "platform/base/Departures.h"
#include "platform/base/Descriptor.h"
#include "platform/base/Mutex.h"
#include "platform/linux/files/Files.h"
#include "platform/objects/DepartureTable.h"
#include "platform/queues/Log.h"
#include "platform/queues/SerialQueue.h"
#include "platform/queues/Timer.h"

namespace kyt {

// The lock of a folder's daemon: kept for its life, so that nobody erases what it may still write.
class DaemonLock {
 public:
  // Waits so long at most. None: somebody keeps it, or the system refuses it; `problem` says so.
  [[nodiscard]] static std::optional<DaemonLock> take(const std::string& folder, Duration patience,
                                                      std::string& problem);
  // `meanwhile`, which may be null, is called now and then; false: it is in vain, and errno says why.
  [[nodiscard]] static std::optional<DaemonLock> take(const std::string& folder, Duration patience,
                                                      std::string& problem,
                                                      const std::function<bool()>& meanwhile);
  // The same for whoever erases: each process that keeps it meanwhile, or takes it before, is told to end (SIGTERM), once.
  // `told`: how many were.
  [[nodiscard]] static std::optional<DaemonLock> takeFromDaemon(const std::string& folder, Duration patience,
                                                                std::string& problem, int& told);
  // The process that keeps it; 0: nobody, or it cannot be seen.
  [[nodiscard]] static pid_t holder(const std::string& folder);

 private:
  explicit DaemonLock(Descriptor file) : file_(std::move(file)) {}
  Descriptor file_;  // no other of that file may be open in this process: closing one would give up the lock
};

// A file that tells the daemon, when it ends, to send nothing any more: whoever erases sets it, then has the daemon end. It
// is locked while whoever set it lives, so that what was left behind is told from an erasure that goes on.
class ErasureMark {
 public:
  explicit ErasureMark(const std::string& folder) : path_(folder + "/erase") {}
  [[nodiscard]] bool stands() const { return identityOf(path_).exists(); }
  // Another process has set it, and lives.
  [[nodiscard]] bool isHeld() const;
  // Sets and holds it; where another process does, waits for that for ever. False: errno says why.
  [[nodiscard]] bool set();
  // One's own, or one that was left behind; true also where there is none, false where another process holds it.
  [[nodiscard]] bool remove();
  [[nodiscard]] const std::string& path() const { return path_; }

 private:
  const std::string path_;
  Descriptor file_;  // while it is held
};

class DepartureFile final : public Departures {
 public:
  static constexpr Duration kWrittenAfter = std::chrono::seconds(30);
  static constexpr size_t kMostBytes = 4 << 20;
  [[nodiscard]] static std::string pathIn(const std::string& folder) { return folder + "/departures.json"; }
  // Of a file that is missing or has another form: an empty table.
  [[nodiscard]] static DepartureTable read(const std::string& folder, JSON& json);

  // All outlive this; the folder exists. `queue` is where the file is written.
  DepartureFile(std::string folder, JSON& json, Log& log, const Clock& clock, TimerService& timers,
                std::shared_ptr<SerialQueue> queue);
  ~DepartureFile() override;

  void add(const Departure& departure) override EXCLUDES(mutex_);
  // Writes what was not written yet. Blocks for that.
  void flush() EXCLUDES(mutex_);

 private:
  void followFile() REQUIRES(mutex_);
  [[nodiscard]] std::optional<std::string> write(const std::string& text);

  const std::string folder_, path_;
  JSON& json_;
  Log& log_;
  const Clock& clock_;
  TimerService& timers_;
  const std::shared_ptr<SerialQueue> queue_;
  Mutex writing_;
  Mutex mutex_;
  DepartureTable table_ GUARDED_BY(mutex_);
  FileIdentity identity_ GUARDED_BY(mutex_);  // of the file as this object knows it
  bool changed_ GUARDED_BY(mutex_) = false;
  TimerHandle timer_ GUARDED_BY(mutex_);
};

}  // namespace kyt
