// A few threads that take turns at one job, of which one leads at any time. The reactor uses it to run short
// pieces of work itself, on the thread that learned of them, and so saves the wake-up of a worker: at a quiet
// rate of events that wake-up is most of what an event costs.
//
// The leading thread calls its work "aside" within beginAside() and endAside(). When that work blocks
// (BlockingScope) or takes longer than two ticks of 10 ms, a standby thread takes the lead; the former leader
// finishes its work and becomes the standby, or ends if there is one. The standby looks at the leader once a
// tick, and only while work is run aside often; so work is run aside only then, and an idle process has no
// wake-ups.
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "platform/base/Clock.h"
#include "platform/base/ConditionVariable.h"
#include "platform/base/Mutex.h"

namespace kyt {

class LeaderThreads {
 public:
  // `lead` runs on the leading thread and returns when endAside() said that the lead is lost, or at a stop.
  LeaderThreads(const char* name, std::function<void()> lead) : name_(name), lead_(std::move(lead)) {}
  ~LeaderThreads() { stop(); }

  [[nodiscard]] bool start();  // false (with errno) when the system refuses a thread
  // Waits for all threads to end. Whoever calls it has made lead() return.
  void stop();

  // The leading thread's. Whether work may be run aside now; asking often is what makes it so.
  [[nodiscard]] bool mayRunAside(MonotonicTime now);
  [[nodiscard]] uint64_t beginAside();           // a number for the following two
  [[nodiscard]] bool endAside(uint64_t number);  // false: this thread leads no longer
  void giveLeadAway(uint64_t number);            // from within the work
  [[nodiscard]] unsigned threads();

 private:
  static constexpr unsigned kMostThreads = 4;  // one leads, one stands by, two finish long work
  static constexpr Duration kTick = std::chrono::milliseconds(10);
  static constexpr Duration kWindow = std::chrono::milliseconds(40);
  static constexpr unsigned kOften = 8;  // in a window

  [[nodiscard]] bool startThread() REQUIRES(mutex_);
  void runThread();
  void standBy() REQUIRES(mutex_);

  const std::string name_;
  const std::function<void()> lead_;

  std::atomic<uint64_t> begun_{0};    // number of the last work that was run aside; only the leader counts
  std::atomic<uint64_t> aside_{0};    // number of the work that the leader runs now, or zero
  std::atomic<bool> watched_{false};  // the standby looks every tick
  // The leading thread's.
  MonotonicTime windowBegin_{};
  unsigned inWindow_ = 0;

  Mutex mutex_;
  ConditionVariable changed_, ended_;
  unsigned threads_ GUARDED_BY(mutex_) = 0;
  bool vacant_ GUARDED_BY(mutex_) = true;  // nobody leads
  bool standby_ GUARDED_BY(mutex_) = false;
  bool stopping_ GUARDED_BY(mutex_) = false;
  // Threads hand their handle on when they end; the next to end joins it.
  std::vector<std::thread> handles_ GUARDED_BY(mutex_);
  std::thread lastEnded_ GUARDED_BY(mutex_);
};

}  // namespace kyt
