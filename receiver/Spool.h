// Posts that the log did not take, on this machine's disk until it does: kept in groups, each with one fdatasync, and given
// to the log again in their order under the IDs that they had. The disk is the outbox's port (platform/PostStore.h).
//
// One thread works with the disk; add(), replayed(), wake() and tick() may be called from any thread and never wait for it.
#pragma once

#include <atomic>
#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "platform/PostStore.h"
#include "platform/base/Clock.h"
#include "platform/base/ConditionVariable.h"
#include "platform/base/Mutex.h"
#include "platform/queues/Log.h"
#include "receiver/EventLog.h"
#include "receiver/Figures.h"

namespace kyt::receiver {

enum class SpoolVerdict : uint8_t { kept, full, broken };
enum class SpoolReplay : uint8_t { stored, failed, never };

// Who gives posts of the spool to the log, and calls Spool::replayed() for each. Called on the spool's thread.
class Replays {
 public:
  virtual ~Replays() = default;
  [[nodiscard]] virtual bool takesReplays() const = 0;  // false: there is no log at the moment
  virtual void replay(int64_t number, std::shared_ptr<const LogMessage> message) = 0;
};

class Spool {
 public:
  // All outlive this.
  Spool(PostStore& store, uint64_t maxBytes, const Clock& clock, Figures& figures, Log& lines);
  ~Spool();  // stop()
  Spool(const Spool&) = delete;
  Spool& operator=(const Spool&) = delete;

  // Finds what an earlier process left. What is wrong, or none. Before all else.
  [[nodiscard]] std::optional<std::string> open();
  // `replays` outlives stop().
  void start(Replays& replays);
  // What was added is kept first.
  void stop() EXCLUDES(mutex_);

  // `done` is called exactly once, on the spool's thread, at once, or by tick().
  void add(std::shared_ptr<const LogMessage> message, std::function<void(SpoolVerdict)> done)
      EXCLUDES(mutex_);
  void replayed(int64_t number, SpoolReplay result) EXCLUDES(mutex_);
  void wake() EXCLUDES(mutex_);  // the log is there: try now
  // Whoever waits too long for the disk is told that it is broken.
  void tick() EXCLUDES(mutex_);

  // One turn of the thread's work: keeps what was added, removes what the log has, gives it more. For the thread, and
  // for tests without one. When there is something to do even if nobody calls.
  std::optional<MonotonicTime> turn(Replays& replays) EXCLUDES(mutex_);

  [[nodiscard]] uint64_t posts() const { return posts_.load(); }
  [[nodiscard]] uint64_t bytes() const { return bytes_.load(); }  // those that wait for the disk included
  [[nodiscard]] uint64_t maxBytes() const { return maxBytes_; }
  [[nodiscard]] uint64_t oldestSeconds() const;  // how long ago the oldest was kept; 0: there is none
  // Whether a post waits that will show whether the log takes messages.
  [[nodiscard]] bool hasReplays() const { return replayable_.load() != 0; }
  [[nodiscard]] bool isBroken() const { return isBroken_.load(); }  // the last change failed

 private:
  struct Adding {
    std::shared_ptr<const LogMessage> message;
    std::function<void(SpoolVerdict)> done;  // empty: it was told already
    uint64_t bytes = 0;
    MonotonicTime since{};
  };
  struct Entry {
    uint64_t bytes = 0;
    int64_t keptAt = 0;  // seconds since 1970
    enum class State : uint8_t { waiting, inFlight, stored, stuck } state = State::waiting;
  };
  using Additions = std::vector<std::shared_ptr<Adding>>;

  void run(Replays& replays) EXCLUDES(mutex_);
  [[nodiscard]] Additions takeAdditions() EXCLUDES(mutex_);
  void takeReplies() EXCLUDES(mutex_);
  [[nodiscard]] bool change(const Additions& added);
  void noteKept(const Additions& added, int64_t first);
  void forget(const std::vector<int64_t>& removed);
  void tell(const Additions& added, SpoolVerdict verdict) EXCLUDES(mutex_);
  void replayMore(Replays& replays);
  [[nodiscard]] std::shared_ptr<const LogMessage> read(int64_t number, Entry& entry);
  void showFigures();

  PostStore& store_;
  const uint64_t maxBytes_;
  const Clock& clock_;
  Figures& figures_;
  Log& lines_;
  std::atomic<uint64_t> posts_{0}, bytes_{0}, replayable_{0};
  std::atomic<int64_t> oldest_{0};
  std::atomic<bool> isBroken_{false};

  // The spool's thread alone.
  std::map<int64_t, Entry> entries_;
  int64_t lastNumber_ = 0;
  int64_t cursor_ = 0;  // what was given to the log last
  size_t inFlight_ = 0, inFlightBytes_ = 0;
  bool hasFailed_ = false;  // one of those in flight: the rest is waited for, then all begins anew
  MonotonicTime nextReplay_{};
  std::vector<int64_t> toRemove_;

  Mutex mutex_;
  ConditionVariable changed_;
  std::deque<std::shared_ptr<Adding>> added_ GUARDED_BY(mutex_);    // not yet taken by the thread
  std::deque<std::shared_ptr<Adding>> waiting_ GUARDED_BY(mutex_);  // not yet told, in their order
  std::vector<std::pair<int64_t, SpoolReplay>> replies_ GUARDED_BY(mutex_);
  bool isWoken_ GUARDED_BY(mutex_) = false;
  bool isStopping_ GUARDED_BY(mutex_) = false;
  std::thread thread_;
};

}  // namespace kyt::receiver
