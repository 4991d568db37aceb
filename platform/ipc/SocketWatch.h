// What a connection's reading and writing wait for, asked of the reactor together: each report is for one time, and takes
// along all that was asked for since the last. Any thread; the mutex is held over the system call.
#pragma once

#include <atomic>
#include <utility>

#include "platform/Reactor.h"
#include "platform/base/Mutex.h"

namespace kyt {

class SocketWatch {
 public:
  // `descriptor` is open until close().
  SocketWatch(Reactor& reactor, int descriptor) : reactor_(reactor), descriptor_(descriptor) {}

  // Asks for one report of `events` (kyt::ready), and of what is asked for already. `makeHandler()` gives the handler,
  // where there is none yet. False when the system refuses. After close() nothing is asked, and that is no refusal.
  template <typename MakeHandler>
  [[nodiscard]] bool arm(unsigned events, MakeHandler&& makeHandler) EXCLUDES(mutex_) {
    MutexLock lock(mutex_);
    if (closed_) return true;
    const unsigned armed = armed_.fetch_or(events);
    if ((armed & events) == events) return true;
    const unsigned wanted = armed | events | ready::oneShot;
    if (watch_) return watch_.modify(wanted);
    watch_ = reactor_.watch(descriptor_, wanted, makeHandler());
    return static_cast<bool>(watch_);
  }

  // The handler says what was reported; returns what is still waited for, and has to be asked for again. It takes no
  // lock: what was armed may be ready at once.
  [[nodiscard]] unsigned reported(unsigned events) { return armed_.exchange(0) & ~events; }

  // Nothing is reported any more when this returns: it waits for a handler that runs on another thread.
  void close() EXCLUDES(mutex_) {
    Watch watch;
    {
      MutexLock lock(mutex_);
      closed_ = true;
      watch = std::move(watch_);
    }
    watch.cancel();
  }

 private:
  Reactor& reactor_;
  const int descriptor_;
  std::atomic<unsigned> armed_{0};
  Mutex mutex_;
  Watch watch_ GUARDED_BY(mutex_);
  bool closed_ GUARDED_BY(mutex_) = false;
};

}  // namespace kyt
