// Delayed work and periodic timers.
//
// TimerService schedules work onto a serial queue. The real one is the reactor (EpollReactor.h); tests
// move ManualTimers.h together with the manual clock. Callable from any thread; never blocks; never fails.
#pragma once

#include <memory>

#include "platform/base/Clock.h"
#include "platform/base/Function.h"

namespace kyt {

class SerialQueue;

// Cancels at destruction. Work that has been handed to its queue already still runs.
class [[nodiscard]] TimerHandle {
 public:
  class State {
   public:
    virtual ~State() = default;
    virtual void cancel() = 0;
  };
  TimerHandle() = default;
  explicit TimerHandle(std::shared_ptr<State> state) : state_(std::move(state)) {}
  TimerHandle(TimerHandle&&) noexcept = default;
  TimerHandle& operator=(TimerHandle&& other) noexcept {
    cancel();
    state_ = std::move(other.state_);
    return *this;
  }
  ~TimerHandle() { cancel(); }
  void cancel() {
    if (auto state = std::move(state_)) state->cancel();
  }
  explicit operator bool() const { return state_ != nullptr; }

 private:
  std::shared_ptr<State> state_;
};

class TimerService {
 public:
  virtual ~TimerService() = default;
  // Runs `work` once on `queue`, `delay` from now (a delay of zero or less: as soon as possible).
  virtual TimerHandle after(Duration delay, std::shared_ptr<SerialQueue> queue, Task work) = 0;
  // Runs `work` on `queue` first one period from now and then every period (at least 1 ms); up to `leeway` late, so
  // that wake-ups can be shared. Ticks that were missed, or that find the one before still waiting for the queue, are
  // not made up for.
  virtual TimerHandle every(Duration period, Duration leeway, std::shared_ptr<SerialQueue> queue,
                            Task work) = 0;
};

}  // namespace kyt
