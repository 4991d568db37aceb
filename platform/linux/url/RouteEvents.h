// Tells that something about the network changed: routes, addresses or links came or went. Subscribed only
// while there are connections or requests wait for connectivity, so that an idle daemon is not woken by every change.
// Network thread only.
#pragma once

#include "platform/base/Descriptor.h"

namespace kyt {

class RouteEvents {
 public:
  // Whether there is a subscription now. Without one (no descriptors, a confinement that forbids it) the slow
  // timer is all that wakes what waits, and each request looks at its session's connections.
  bool subscribe();
  void unsubscribe() { socket_ = {}; }
  [[nodiscard]] int descriptor() const {
    return socket_.get();
  }  // readable after an event; -1: not subscribed
  // Forgets the events that came; whether there were any.
  [[nodiscard]] bool takeAll();

 private:
  Descriptor socket_;
};

}  // namespace kyt
