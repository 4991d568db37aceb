// Tells that something about the network changed: routes, addresses or links came or went. Subscribed only
// while there are connections or requests wait for connectivity, so that an idle daemon is not woken by every change.
// Network thread only.
#pragma once

namespace kyt {

class RouteEvents {
 public:
  RouteEvents() = default;
  ~RouteEvents() { unsubscribe(); }
  RouteEvents(const RouteEvents&) = delete;
  RouteEvents& operator=(const RouteEvents&) = delete;

  // Whether there is a subscription now. Without one (no descriptors, a confinement that forbids it) the slow
  // timer is all that wakes what waits, and each request looks at its session's connections.
  bool subscribe();
  void unsubscribe();
  [[nodiscard]] int descriptor() const { return socket_; }  // readable after an event; -1: not subscribed
  // Forgets the events that came; whether there were any.
  [[nodiscard]] bool takeAll();

 private:
  int socket_ = -1;
};

}  // namespace kyt
