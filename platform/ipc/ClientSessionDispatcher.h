// Turns messages into the operations of ClientSessionInterface and what they answer into replies: the
// contract of docs/com.vantu.kytreportingd.xml.
//
// One object serves all connections; it has no state of its own. The objects that the connections export are sessions. It
// calls them on the connection's queue. Replies may come later from any thread: they hold the connection's output, and
// answer "Failed" when they are dropped uncalled.
#pragma once

#include <string>

#include "platform/ipc/ClientSessionInterface.h"
#include "platform/ipc/MessageDispatcher.h"
#include "platform/ipc/StandardInterfaces.h"

namespace kyt {

class Counters;

class ClientSessionDispatcher final : public MessageDispatcher {
 public:
  // `machineId`: 32 hexadecimal digits.
  ClientSessionDispatcher(Counters& counters, std::string machineId);
  [[nodiscard]] const char* handle(const Message& message, const Peer& peer) const override;

 private:
  const char* handleCall(const Message& message, const Peer& peer) const;

  Counters& counters_;
  const StandardInterfaces standard_;
};

// The text that Introspect answers for the interface's own object: the first interface of
// docs/com.vantu.kytreportingd.xml.
[[nodiscard]] std::string clientSessionIntrospection();

}  // namespace kyt
