// The reactor and timer service of Linux: one thread, "kyt-reactor", that sleeps in epoll until a descriptor
// is ready or a timer is due, and never otherwise. All timers share one timerfd, set to the latest moment
// that suits every timer's leeway; setting or cancelling a timer costs a system call only when that moment
// changes, and wakes nobody.
//
// What a handler or a timer gives to an idle queue is run by the reactor's own thread when such events are
// frequent but short, for then the wake-up of a worker would cost more than the work. When that work blocks,
// or takes longer than some 20 ms, another thread of the same name goes on waiting for events
// (LeaderThreads); busy queues move to their executor with their first unfinished turn.
//
// create() starts the thread, so a program that confines itself does that first. Watches and timers may
// outlive the reactor; they are silent then.
#pragma once

#include <cstdint>
#include <memory>

#include "platform/Reactor.h"
#include "platform/queues/Timer.h"

namespace kyt {

class EpollReactor final : public Reactor, public TimerService {
 public:
  // Null (with errno) when the system refuses descriptors or a thread.
  [[nodiscard]] static std::unique_ptr<EpollReactor> create(const char* threadName = "kyt-reactor");
  ~EpollReactor() override;  // stop()

  Watch watch(int descriptor, unsigned events, Handler handler) override;
  TimerHandle after(Duration delay, std::shared_ptr<SerialQueue> queue, Task work) override;
  TimerHandle every(Duration period, Duration leeway, std::shared_ptr<SerialQueue> queue, Task work) override;

  // Ends its threads after the handler and the queues that they run; no handler and no timer runs afterwards.
  // Not from a handler, nor from work that may run on its threads.
  void stop();

  // How often the thread has woken up.
  [[nodiscard]] uint64_t wakeUps() const;
  // One, or a few while work is run here.
  [[nodiscard]] unsigned threads() const;

 private:
  class Implementation;
  class Registration;
  class Timer;
  explicit EpollReactor(std::shared_ptr<Implementation> implementation);
  std::shared_ptr<Implementation> implementation_;
};

}  // namespace kyt
