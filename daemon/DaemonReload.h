// Takes up changed settings while the daemon runs: all that can be, or, when the file is wrong in any way, nothing. The
// composition root owns the one object.
//
// Any thread, one reload at a time. The settings that the daemon runs with change under those who read them, which only
// numbers may (Adjustable.h); of the others those that count while it runs are read here alone.
#pragma once

#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "platform/base/Mutex.h"
#include "platform/base/Settings.h"
#include "platform/queues/Log.h"

namespace kyt {

class DaemonReload {
 public:
  struct Parts {
    std::string file;   // of the settings
    Settings& running;  // outlives this
    Log& log;
    std::optional<LogLevel> commandLine;  // then the file's level counts for nothing
    std::function<void(const Settings&)> takeUp;
  };
  // A line for each setting that differs, or one that nothing has changed; with a problem there is none.
  struct Outcome {
    std::vector<std::string> lines;
    std::optional<std::string> problem;  // "FILE:LINE: what is wrong: nothing is taken up"
  };
  explicit DaemonReload(Parts parts) : parts_(std::move(parts)) {}
  DaemonReload(const DaemonReload&) = delete;
  DaemonReload& operator=(const DaemonReload&) = delete;

  // "NAME: taken up", "NAME: counts after a restart", "NAME: not taken up: why". All of it stands in the log too.
  Outcome reload() EXCLUDES(mutex_);

 private:
  // What becomes of a setting that differs, if it is not taken up.
  [[nodiscard]] std::optional<std::string> hindrance(const std::string& setting, const Settings& read) const;

  const Parts parts_;
  Mutex mutex_;
};

}  // namespace kyt
