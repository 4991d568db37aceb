// Says when routes or addresses have changed: at once how often, and, since such changes come in bursts, a moment after the
// first of a burst that it is time to look at what depends on them. A slow timer is the second net under the kernel's
// events. Network thread only.
#pragma once

#include <cstdint>

#include "platform/base/Function.h"
#include "platform/linux/url/DeadlineHeap.h"
#include "platform/linux/url/NetworkTools.h"
#include "platform/linux/url/RouteEvents.h"

namespace kyt {

class RouteWatch {
 public:
  static constexpr uint64_t kEpollKey = ~uint64_t{0} - 1;  // of its events, in the event loop

  struct Callbacks {
    Function<void()> settled;    // a moment after a change
    Function<void()> slowTimer;  // from time to time, while it listens
    Function<bool()> isNeeded;   // asked then: whether it is to go on listening
  };
  RouteWatch(NetworkTools& tools, Callbacks callbacks);

  void setEpoll(int descriptor) { epoll_ = descriptor; }
  // Subscribes to the kernel's events unless it has. Where that fails it is tried again with each request.
  void listen();
  [[nodiscard]] bool isListening() const { return events_.descriptor() >= 0; }
  // Takes note of the events that have come. Costs a system call.
  void takeEvents();
  // The same before a request goes. Where nobody tells of changes, there may have been one.
  void takeEventsOrSuspectSome();
  // Something may have changed: settled() runs soon.
  void settleSoon();
  // How often routes and addresses have changed, as far as it is known.
  [[nodiscard]] uint64_t changes() const { return changes_; }

 private:
  void noteChange();
  void settled() { callbacks_.settled(); }
  void slowTimerFired();

  NetworkTools& tools_;
  Callbacks callbacks_;
  int epoll_ = -1;
  RouteEvents events_;
  bool isDeaf_ = false;  // there could be no subscription: nobody told of the last changes
  uint64_t changes_ = 0;
  Deadline settle_, slow_;
};

}  // namespace kyt
