// The listener of the named IPC service and its connections, as the agent sees them. The real ones are
// platform/ipc/DBusServer.h over Unix sockets; tests use platform/ipc/fake/FakeListener.h.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>

#include "platform/base/Function.h"
#include "platform/objects/Value.h"

namespace kyt {

class ClientSessionReplyInterface;
class SerialQueue;
class UserAccount;

// What a connection's peer calls: a session (ClientSessionInterface.h) or a window (AdministrationInterface.h), by the
// socket that it came to.
class ExportedObject {
 public:
  virtual ~ExportedObject() = default;
};

class Connection {
 public:
  virtual ~Connection() = default;
  // entitlementValue(), isPeerInGroup(), description() and what is set before resume(), which it ends, are called on
  // queue(); the rest by any thread.
  //
  // The value that the peer holds under an entitlement key; null when it holds none. Only before resume().
  [[nodiscard]] virtual Value entitlementValue(std::string_view key) = 0;
  // One line for logs: what identifies the peer (process, user, executable) and this connection.
  [[nodiscard]] virtual std::string description() const = 0;
  [[nodiscard]] virtual uint32_t peerUser() const = 0;
  // The number that the peer's process had when it connected; 0: not known.
  [[nodiscard]] virtual int32_t peerProcess() const { return 0; }
  // Whether it is the peer's group or one of its supplementary ones, says the kernel. Only before resume().
  [[nodiscard]] virtual bool isPeerInGroup(uint32_t /*group*/) const { return false; }
  // Where what is kept on the client's behalf is counted; null: nowhere.
  [[nodiscard]] virtual std::shared_ptr<UserAccount> userAccount() const { return nullptr; }
  // Called before resume(). The connection keeps the object until it is invalidated.
  virtual void setExportedObject(std::shared_ptr<ExportedObject> object) = 0;
  // Run on the connection's queue. An interruption comes before an invalidation when the stream broke in the
  // middle of a message or by an error; the invalidation comes exactly once, last, after every call that was
  // read has been handled, and then both handlers and the exported object are dropped.
  virtual void setInterruptionHandler(Task handler) = 0;
  virtual void setInvalidationHandler(Task handler) = 0;
  virtual void resume() = 0;
  // Ends the connection: what was queued is written as far as the socket takes it without waiting. Any
  // thread.
  virtual void invalidate() = 0;
  // Shut-down: stops reading, runs the invalidation handler on the queue, writes what is queued, then closes.
  virtual void finish() = 0;
  [[nodiscard]] virtual ClientSessionReplyInterface& remoteObjectProxy() = 0;
  [[nodiscard]] virtual const std::shared_ptr<SerialQueue>& queue() const = 0;
};

class Listener;

class ListenerDelegate {
 public:
  virtual ~ListenerDelegate() = default;
  // Called for each new connection before a byte was read from it, on the connection's queue. NO closes it at
  // once.
  [[nodiscard]] virtual bool listenerShouldAcceptNewConnection(
      Listener& listener, const std::shared_ptr<Connection>& connection) = 0;
};

class Listener {
 public:
  virtual ~Listener() = default;
  virtual void setDelegate(ListenerDelegate& delegate) = 0;
  virtual void resume() = 0;
  // Stops accepting (shut-down). Connections stay.
  virtual void stopAccepting() = 0;
};

}  // namespace kyt
