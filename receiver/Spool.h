// Posts that the log did not take, on this machine's disk until it does: kept in groups, each with one fdatasync, and given
// to the log again in their order under the IDs that they had. The disk is the outbox's port (platform/PostStore.h).
//
// Each of the log's partitions has a lane of its own: one that takes nothing is tried with one post after another, every
// Limits::replayPause, while those of the others go on.
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
#include <set>
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
#include "receiver/Limits.h"

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
  // All outlive this. `partitions`: of the log, 1 at least.
  // `prepare` is called before the store is opened: what keeps it from that, or none. `isOurs`: false once the folder that was
  // prepared is not there any more; what is in the open file still goes to the log, then it is prepared anew.
  Spool(PostStore& store, uint64_t maxBytes, const Clock& clock, Figures& figures, Log& lines,
        uint32_t partitions = 1, std::function<std::optional<std::string>()> prepare = {},
        std::function<bool()> isOurs = {});
  ~Spool();  // stop()
  Spool(const Spool&) = delete;
  Spool& operator=(const Spool&) = delete;

  // Finds what an earlier process left. Before all else. Where the disk does not give it, that is said, the spool is broken, and
  // the thread tries again (Limits::reopenPause).
  void open();
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
  // Whether a post waits that will show whether that partition of the log takes messages.
  [[nodiscard]] bool hasReplays(uint32_t partition) const { return lanes_.at(partition).isReplayable.load(); }
  [[nodiscard]] uint32_t partitions() const { return static_cast<uint32_t>(lanes_.size()); }
  [[nodiscard]] uint64_t damagedFiles() const { return store_.filesAside(); }  // that lie beside it
  // The last change failed, or it is not open.
  [[nodiscard]] bool isBroken() const { return isBroken_.load(); }
  // Whether a post may be kept, or may try: false for Limits::brokenTime after a change failed, and while it is not open.
  [[nodiscard]] bool mayKeep() const;

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
    uint32_t partition = 0;
    bool isFailureTold = false;  // that the disk does not give it
    enum class State : uint8_t { waiting, inFlight, stored } state = State::waiting;
  };
  // A partition's posts. All but the flag are the spool's thread's alone.
  struct Lane {
    std::set<int64_t> waiting;
    int64_t cursor =
        0;  // what was given to the log last; the next is the one behind it, from the end on the oldest
    size_t inFlight = 0, inFlightBytes = 0;
    size_t window = Limits::maxReplayPosts;  // so many may be in flight
    bool isFailing = false;                  // the last answer was a failure
    bool isUnread = false;                   // the disk did not give its post
    MonotonicTime nextReplay{};
    std::atomic<bool> isReplayable{false};
  };
  using Additions = std::vector<std::shared_ptr<Adding>>;

  void run(Replays& replays) EXCLUDES(mutex_);
  [[nodiscard]] Additions takeAdditions() EXCLUDES(mutex_);
  void takeReplies() EXCLUDES(mutex_);
  [[nodiscard]] std::optional<std::string> problemOfOpening();
  void lookForFolder();
  [[nodiscard]] bool change(const Additions& added);
  void forget(const std::vector<int64_t>& removed);
  void tell(const Additions& added, SpoolVerdict verdict) EXCLUDES(mutex_);
  void enter(int64_t number, Entry entry);
  void fail(Lane& lane);
  void setStuck(int64_t number);
  void setAside(const std::string& why);
  void forgetAll();
  void replayMore(Replays& replays, MonotonicTime now);
  [[nodiscard]] bool hasRoomFor(const Lane& lane) const;
  [[nodiscard]] bool replayNext(Lane& lane, Replays& replays, MonotonicTime now);
  [[nodiscard]] std::shared_ptr<const LogMessage> read(int64_t number, Lane& lane);
  [[nodiscard]] std::optional<MonotonicTime> nextTurn(MonotonicTime now, bool takesReplays) const;
  void showFigures();

  PostStore& store_;
  const uint64_t maxBytes_;
  const Clock& clock_;
  Figures& figures_;
  Log& lines_;
  std::atomic<uint64_t> posts_{0}, bytes_{0};
  std::atomic<int64_t> oldest_{0};
  std::atomic<bool> isBroken_{false}, isOpen_{false};
  std::atomic<MonotonicTime> failedAt_{MonotonicTime{}};  // the last change that did

  std::vector<Lane> lanes_;  // by partition

  const std::function<std::optional<std::string>()> prepare_;
  const std::function<bool()> isOurs_;
  bool isLost_ = false;  // its folder is gone, and the open file has posts for the log

  // The spool's thread alone.
  MonotonicTime nextOpening_{};
  std::map<int64_t, Entry> entries_;          // but for those that are stuck
  uint64_t stuckPosts_ = 0, stuckBytes_ = 0;  // that the log never takes, or the disk does not give
  int64_t lastNumber_ = 0;
  size_t nextLane_ = 0;
  size_t inFlight_ = 0, inFlightBytes_ = 0;
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
