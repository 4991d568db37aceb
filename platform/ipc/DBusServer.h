// The daemon's side of the IPC service: the real Listener. Accepts on its own serial queue whenever the
// reactor says so, refuses what passes the limits of connections, and offers the rest to the delegate, each
// on its own queue. When the system has no descriptors left, or refuses anything else, it waits a little before it
// tries again; connections that exist go on.
//
// Owned by the composition root. The delegate and all services outlive it; it outlives nothing: its
// connections share what they need, and are abandoned at its destruction when they have not ended before.
#pragma once

#include <cstddef>
#include <memory>

#include "platform/Reactor.h"
#include "platform/Stream.h"
#include "platform/base/Mutex.h"
#include "platform/ipc/Listener.h"
#include "platform/ipc/ServerContext.h"
#include "platform/queues/Timer.h"

namespace kyt {

class DBusServer final : public Listener {
 public:
  DBusServer(DBusServerServices services, std::unique_ptr<StreamAcceptor> acceptor);
  ~DBusServer() override;
  void setDelegate(ListenerDelegate& delegate) override { delegate_ = &delegate; }
  void resume() override;
  void stopAccepting() override;
  // For a while, or until stopAccepting(): who connects meanwhile waits in the socket's line. Nothing is accepted any
  // more when it returns, and what was accepted is counted. Not from the listener's or a connection's queue.
  void pauseAccepting();
  void resumeAccepting();
  // The number of connections, ending ones included. Any thread.
  [[nodiscard]] size_t connectionCount() const { return context_->connectionCount(); }
  // The deadline of a shut-down: invalidates every connection that is left.
  void invalidateConnections();

 private:
  class Acceptance;
  const std::shared_ptr<ServerContext> context_;
  std::shared_ptr<Acceptance> acceptance_;
  ListenerDelegate* delegate_ = nullptr;
};

}  // namespace kyt
