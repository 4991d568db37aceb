// Keeps the clients of one user from flooding the log: of each text at most so many lines a second
// of theirs are written; then one line says how many were left out. Lines of the debug level are never left out.
//
// The log asks for each line of another level that a thread writes while it works for a client, which a ClientScope
// says. Any thread. The composition root owns the one object and hands it to the log.
#pragma once

#include <array>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <utility>
#include <vector>

#include "platform/base/Clock.h"
#include "platform/base/Mutex.h"
#include "platform/queues/Timer.h"

namespace kyt {

class Log;
class SerialQueue;

// This thread works for a client of that user, until the end of the scope. Scopes may be nested: the inner one counts.
class ClientScope {
 public:
  explicit ClientScope(std::optional<uint32_t> user);
  ~ClientScope();
  ClientScope(const ClientScope&) = delete;
  ClientScope& operator=(const ClientScope&) = delete;
  [[nodiscard]] static std::optional<uint32_t> user();

 private:
  const std::optional<uint32_t> before_;
};

class LineLimits {
 public:
  // Everything outlives this; `most` is of lines (Share::logLines). `queue` runs what tells how many lines were left out, a second later.
  LineLimits(Log& log, Clock& clock, TimerService& timers, std::shared_ptr<SerialQueue> queue, uint64_t most);
  ~LineLimits();
  LineLimits(const LineLimits&) = delete;
  LineLimits& operator=(const LineLimits&) = delete;

  // Whether a line of this format may be written on behalf of the user. Formats are compared by their address.
  [[nodiscard]] bool admits(uint32_t user, const char* format) EXCLUDES(mutex_);
  // Writes what is left to be told. Then the log no longer asks.
  void finish() EXCLUDES(mutex_);

 private:
  struct Lines {
    MonotonicTime since;
    unsigned written = 0;
    uint64_t leftOut = 0;
  };
  using Key = std::pair<uint32_t, const char*>;
  void tell() EXCLUDES(mutex_);

  Log& log_;
  Clock& clock_;
  TimerService& timers_;
  const std::shared_ptr<SerialQueue> queue_;
  const uint64_t most_;
  Mutex mutex_;
  std::map<Key, Lines> lines_ GUARDED_BY(mutex_);
  bool telling_ GUARDED_BY(mutex_) = false;  // a timer is set
  bool finished_ GUARDED_BY(mutex_) = false;
  TimerHandle timer_ GUARDED_BY(mutex_);
};

}  // namespace kyt
