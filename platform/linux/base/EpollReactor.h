// The reactor and timer service of Linux: one thread, "kyt-reactor", that sleeps in epoll until a descriptor
// is ready or a timer is due, and never otherwise. All timers share one timerfd, set to the latest moment
// that suits every timer's leeway; setting or cancelling a timer costs a system call only when that moment
// changes, and wakes nobody.
//
// create() starts the thread, so a program that confines itself does that first. Watches and timers may
// outlive the reactor; they are silent then.
#pragma once

#include <cstdint>
#include <memory>

#include "platform/Reactor.h"
#include "platform/Timer.h"

namespace kyt {

class EpollReactor final : public Reactor, public TimerService {
 public:
  // Null (with errno) when the system refuses descriptors or a thread.
  [[nodiscard]] static std::unique_ptr<EpollReactor> create(const char* threadName = "kyt-reactor");
  ~EpollReactor() override;  // stop()

  Watch watch(int descriptor, unsigned events, Handler handler) override;
  TimerHandle after(Duration delay, std::shared_ptr<SerialQueue> queue, Task work) override;
  TimerHandle every(Duration period, Duration leeway, std::shared_ptr<SerialQueue> queue, Task work) override;

  // Ends the thread after the handler that runs; no handler and no timer runs afterwards. Not from a handler.
  void stop();

  // How often the thread has woken up.
  [[nodiscard]] uint64_t wakeUps() const;

 private:
  class Implementation;
  class Registration;
  class Timer;
  explicit EpollReactor(std::shared_ptr<Implementation> implementation);
  std::shared_ptr<Implementation> implementation_;
};

}  // namespace kyt
