// Turns messages into the operations of ClientSessionInterface and what they answer into replies: the
// contract of docs/com.vantu.kytreportingd.xml, and the standard interfaces that general tools need (Hello,
// Ping, GetMachineId, Introspect, GetAll).
//
// One object serves all connections; it has no state of its own. handle() is called on the connection's queue
// and calls the session on the same. Replies may come later from any thread: they hold the connection's
// output, and answer "Failed" when they are dropped uncalled.
#pragma once

#include <memory>
#include <span>
#include <string>
#include <string_view>

#include "platform/ipc/ClientSessionInterface.h"
#include "platform/ipc/ConnectionOutput.h"
#include "platform/ipc/MessageReader.h"

namespace kyt {

class Counters;

struct ClientSessionDispatcherOptions {
  std::string machineId;      // 32 hexadecimal digits
  std::string introspection;  // the interface's XML
};

class ClientSessionDispatcher {
 public:
  ClientSessionDispatcher(Counters& counters, ClientSessionDispatcherOptions options);

  // What handle() may use of a connection.
  struct Peer {
    ClientSessionInterface& session;
    const std::shared_ptr<ConnectionOutput>& output;
    std::span<Descriptor> descriptors;  // of the message; the session may take them
    uint64_t connectionNumber;          // the unique name is ":1.N"
    Stream* stream = nullptr;           // asked who the client is when a call needs its rights; none: nobody
  };
  // Null, or why the message is malformed (then the connection must end and nothing was called or answered).
  [[nodiscard]] const char* handle(const Message& message, const Peer& peer) const;

 private:
  const char* handleCall(const Message& message, const Peer& peer) const;
  const char* handleStandard(const Message& message, const Peer& peer, bool& handled) const;
  const char* introspect(const Message& message, const Peer& peer) const;
  const char* getAll(const Message& message, const Peer& peer) const;
  const char* refuse(const Message& message, const Peer& peer, std::string_view error,
                     std::string_view text) const;

  Counters& counters_;
  const ClientSessionDispatcherOptions options_;
};

// The text that Introspect answers for the interface's own object: the first interface of
// docs/com.vantu.kytreportingd.xml.
[[nodiscard]] std::string clientSessionIntrospection();

}  // namespace kyt
