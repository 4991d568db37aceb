// Where a post goes once it is found good: to the log, and where that does not acknowledge in time, to the spool. A
// partition of the log that failed is left alone until it has taken something of the spool: its posts then go there at once
// and need not wait.
// Any thread; callbacks run on threads of the log or the spool, with no lock held.
#pragma once

#include <atomic>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <optional>
#include <unordered_map>
#include <vector>

#include "platform/base/Clock.h"
#include "platform/base/Mutex.h"
#include "platform/queues/Log.h"
#include "receiver/EventLog.h"
#include "receiver/Figures.h"
#include "receiver/Spool.h"

namespace kyt::receiver {

// What became of a post.
enum class Fate : uint8_t { stored, spooled, spoolFull, spoolBroken, tooLargeForLog };

class Delivery final : public LogListener, public Replays {
 public:
  using Done = std::function<void(Fate)>;
  // All outlive this, but what is called by them must have stopped before it ends: the log, the spool.
  Delivery(EventLog& log, Spool& spool, const Clock& clock, Figures& figures, Log& lines,
           Duration publishTime);

  // `done` is called exactly once.
  void take(std::shared_ptr<const LogMessage> message, Done done) EXCLUDES(mutex_);
  // What the log did not acknowledge in time goes to the spool. To be called several times in that time.
  void tick() EXCLUDES(mutex_);

  [[nodiscard]] bool wasUp() const { return wasUp_.load(); }  // the log was there once
  [[nodiscard]] bool isUp() const { return isUp_.load(); }
  // It is there, and of the partitions that were given messages not all have failed and taken nothing since.
  [[nodiscard]] bool takesMessages() const {
    const uint64_t failing = failing_.load();
    return isUp() && (failing == 0 || failing < used_.load());
  }
  [[nodiscard]] uint64_t pending() EXCLUDES(mutex_);  // messages on their way to the log
  [[nodiscard]] uint64_t failing() const {
    return failing_.load();
  }  // partitions whose posts go to the spool

  void logAnswered(uint64_t token, const LogAnswer& answer) override EXCLUDES(mutex_);
  void partitionRefused(uint32_t partition, const std::string& why) override EXCLUDES(mutex_);
  void deadLetterAnswered(bool isStored) override {
    count(isStored ? figures_.deadLetters : figures_.deadLettersLeftOut);
  }
  void logIsUp(bool isUp) override EXCLUDES(mutex_);
  [[nodiscard]] bool takesReplays() const override { return isUp(); }
  void replay(int64_t number, std::shared_ptr<const LogMessage> message) override EXCLUDES(mutex_);

 private:
  struct Pending {
    std::shared_ptr<const LogMessage> message;
    Done done;           // of a post; empty for one of the spool
    int64_t number = 0;  // of one of the spool
    MonotonicTime since{};
  };
  struct Partition {
    std::atomic<bool> isTrusted{true};   // its last answer, or lack of one, was no failure
    std::atomic<bool> isFailing{false};  // it failed, and has taken nothing since
    std::atomic<bool> isUsed{false};     // there was an answer of it, or the lack of one
    MonotonicTime distrustedAt{};        // of mutex_
  };
  [[nodiscard]] uint32_t partitionOf(const LogMessage& message) const;
  [[nodiscard]] uint64_t enter(Pending pending) EXCLUDES(mutex_);
  void answered(Pending pending, const LogAnswer& answer);
  void refused(Pending pending);
  void keep(std::shared_ptr<const LogMessage> message, Done done);
  void use(Partition& partition);
  void trust(uint32_t partition);
  void distrust(uint32_t partition, const char* why) EXCLUDES(mutex_);
  void tellFull(const std::string& why);
  void tellRefusedForGood(const std::string& why) EXCLUDES(mutex_);
  [[nodiscard]] std::vector<Pending> takeLate(MonotonicTime now) EXCLUDES(mutex_);

  EventLog& log_;
  Spool& spool_;
  const Clock& clock_;
  Figures& figures_;
  Log& lines_;
  const Duration publishTime_;
  std::atomic<bool> isUp_{false}, wasUp_{false};
  std::vector<Partition> partitions_;
  std::atomic<uint64_t> failing_{0}, used_{0};
  std::atomic<bool> isFullTold_{false};
  Mutex mutex_;
  uint64_t lastToken_ GUARDED_BY(mutex_) = 0;
  uint64_t refusedSince_ GUARDED_BY(mutex_) = 0;  // for good, and not told of
  std::optional<MonotonicTime> refusalToldAt_ GUARDED_BY(mutex_);
  std::unordered_map<uint64_t, Pending> pending_ GUARDED_BY(mutex_);
  std::deque<std::pair<MonotonicTime, uint64_t>> deadlines_ GUARDED_BY(mutex_);  // in their order
};

}  // namespace kyt::receiver
