// Tells the service manager that the daemon lives, when it asks for that (a unit's WatchdogSec=).
//
// What is told must be true: a sign of life is a timer of the reactor whose work a worker of the pool has run. When
// either hangs no sign leaves, and the service manager ends the process and starts another. A pool of which every
// worker waits for something all the time hangs too, as far as anybody can tell. Without being asked there is no
// timer, and so no wake-up.
#pragma once

#include <memory>
#include <optional>

#include "platform/base/Clock.h"
#include "platform/base/Function.h"
#include "platform/queues/Executor.h"
#include "platform/queues/Timer.h"

namespace kyt {

class Watchdog {
 public:
  // How long the service manager waits for a sign of life (WATCHDOG_USEC), when it waits for one of this process
  // (WATCHDOG_PID, where it says so). Only before other threads change the environment.
  [[nodiscard]] static std::optional<Duration> requestedInterval();

  // Calls `alive` on a worker of `workers` twice in each interval, from now on. No work that waits for the former sign
  // piles up. Destroyed after timers and workers have ended.
  Watchdog(Duration interval, TimerService& timers, Executor& workers, Task alive);
  ~Watchdog();
  Watchdog(const Watchdog&) = delete;
  Watchdog& operator=(const Watchdog&) = delete;

 private:
  class WorkersAlone;
  std::unique_ptr<WorkersAlone> workers_;
  TimerHandle timer_;
};

}  // namespace kyt
