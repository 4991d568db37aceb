// What a server does with the messages of its connections. A server has one dispatcher, which knows what kind of object its
// delegate lets the connections export: sessions (ClientSessionDispatcher) or windows (AdministrationDispatcher).
#pragma once

#include <cstdint>
#include <memory>
#include <span>

#include "platform/base/Descriptor.h"
#include "platform/ipc/Listener.h"

namespace kyt {

class ConnectionOutput;
class Stream;
struct Message;

class MessageDispatcher {
 public:
  // What handle() may use of a connection.
  struct Peer {
    ExportedObject& object;
    const std::shared_ptr<ConnectionOutput>& output;
    std::span<Descriptor> descriptors;  // of the message; the object may take them
    uint64_t connectionNumber;          // the unique name is ":1.N"
    Stream* stream = nullptr;           // asked who the client is when a call needs its rights; none: nobody
  };
  virtual ~MessageDispatcher() = default;
  // On the connection's queue. Null, or why the message is malformed (then the connection must end and nothing was called
  // or answered).
  [[nodiscard]] virtual const char* handle(const Message& message, const Peer& peer) const = 0;
};

}  // namespace kyt
