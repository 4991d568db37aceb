// How long a connection waits for the rest of a message that its client began. One timer at a time, which looks whether
// any message was completed since it was set: so an unfinished one ends its connection after once to twice the time, and a
// client that sends without a pause costs a timer now and then. One thread at a time.
#pragma once

#include <memory>
#include <utility>

#include "platform/queues/Timer.h"

namespace kyt {

class Patience {
 public:
  explicit Patience(TimerService& timers) : timers_(timers) {}

  // Runs `work` on `queue` after so long. Not while it runs.
  void begin(Duration time, std::shared_ptr<SerialQueue> queue, Task work) {
    progress_ = false;
    timer_ = timers_.after(time, std::move(queue), std::move(work));
  }
  [[nodiscard]] bool running() const { return static_cast<bool>(timer_); }
  // A message was completed.
  void sawProgress() { progress_ = true; }
  // Said by the work: the time is over. Returns whether no message was completed meanwhile.
  [[nodiscard]] bool ranOut() {
    timer_.cancel();
    return !progress_;
  }
  // Gives up the waiting, for good.
  void end() { timer_.cancel(); }

 private:
  TimerService& timers_;
  TimerHandle timer_;
  bool progress_ = false;
};

}  // namespace kyt
