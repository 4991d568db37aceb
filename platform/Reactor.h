// The reactor: one thread that waits for all descriptors and timers. The IPC connections, the listener and
// datagram sockets register here. The real one is platform/linux/base/EpollReactor.h, which is the timer
// service as well.
//
// watch() may be called from any thread, also from handlers, and never blocks. Handlers run on the reactor's
// thread, one at a time, and must be short: they hand the readiness on to a serial queue. What a handler
// captures lives as long as its watch. The reactor never closes a descriptor; destroy the watch before
// closing it. An empty Watch means that the operating system refused (no such descriptor, one that cannot be
// waited for, no memory).
//
// A connection that wants few system calls registers once, `edgeTriggered`, for all it is interested in. Its
// handler then runs once for each change, and whoever reads must read until the socket has no more. With
// `oneShot` the watch is silent after a report until rearm(). Otherwise a handler is called again and again
// while the descriptor is ready.
#pragma once

#include <memory>
#include <utility>

#include "platform/base/Function.h"

namespace kyt {

namespace ready {
inline constexpr unsigned readable = 1;
inline constexpr unsigned writable = 2;
// The peer sends no more (reported with `readable`), or is gone (always reported).
inline constexpr unsigned ended = 4;
inline constexpr unsigned failed = 8;     // an error waits in the socket (always reported)
inline constexpr unsigned priority = 16;  // out-of-band data, or what the descriptor's kind uses it for
// How to report; these never come to a handler.
inline constexpr unsigned edgeTriggered = 32;
inline constexpr unsigned oneShot = 64;
}  // namespace ready

// Ends at destruction: then the handler is not running and never runs again, unless the watch is destroyed by
// the handler itself, which may finish. So whoever destroys a watch on another thread waits for a handler
// that is running, and must hold no lock that the handler takes. rearm() and modify() are one system call
// each and may be called from any thread; false when the operating system refuses.
class [[nodiscard]] Watch {
 public:
  class State {
   public:
    virtual ~State() = default;
    [[nodiscard]] virtual bool modify(unsigned events) = 0;
    [[nodiscard]] virtual bool rearm() = 0;
    virtual void cancel() = 0;
  };
  Watch() = default;
  explicit Watch(std::shared_ptr<State> state) : state_(std::move(state)) {}
  Watch(Watch&&) noexcept = default;
  Watch& operator=(Watch&& other) noexcept {
    if (this != &other) {
      cancel();
      state_ = std::move(other.state_);
    }
    return *this;
  }
  ~Watch() { cancel(); }
  void cancel() {
    if (auto state = std::move(state_)) state->cancel();
  }
  // What is reported from now on. A condition that holds already is reported again, edge-triggered or not.
  [[nodiscard]] bool modify(unsigned events) { return state_ != nullptr && state_->modify(events); }
  [[nodiscard]] bool rearm() { return state_ != nullptr && state_->rearm(); }
  explicit operator bool() const { return state_ != nullptr; }

 private:
  std::shared_ptr<State> state_;
};

class Reactor {
 public:
  using Handler = Function<void(unsigned ready)>;  // bits of kyt::ready
  virtual ~Reactor() = default;
  // `events`: readable, writable, priority, and how to report.
  virtual Watch watch(int descriptor, unsigned events, Handler handler) = 0;
};

}  // namespace kyt
