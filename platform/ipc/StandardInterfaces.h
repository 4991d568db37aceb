// The standard interfaces that general tools need (Hello, Ping, GetMachineId, Introspect, GetAll), on an object with one
// interface of ours, and what is said of calls that nobody knows. Used by the dispatchers; no state.
#pragma once

#include <string>
#include <string_view>

#include "platform/ipc/MessageDispatcher.h"

namespace kyt {

class Counters;

class StandardInterfaces {
 public:
  using Peer = MessageDispatcher::Peer;
  struct Options {
    std::string_view interface;  // ours, at wire::kSessionPath
    std::string machineId;       // 32 hexadecimal digits
    std::string introspection;   // the interface's XML
  };
  StandardInterfaces(Counters& counters, Options options)
      : counters_(counters), options_(std::move(options)) {}

  // Answers a call that is none of ours. Null, or why the message is malformed.
  [[nodiscard]] const char* handle(const Message& call, const Peer& peer) const;
  // Answers with an error. Null, or why the message is malformed.
  static const char* refuse(const Message& call, const Peer& peer, std::string_view error,
                            std::string_view text);

 private:
  [[nodiscard]] bool isOurs(std::string_view interface) const {
    return interface == options_.interface || interface.empty();
  }
  const char* handleKnown(const Message& call, const Peer& peer, bool& handled) const;
  const char* introspect(const Message& call, const Peer& peer) const;
  const char* getAll(const Message& call, const Peer& peer) const;

  Counters& counters_;
  const Options options_;
};

// The text that Introspect answers for an object whose interface is the first of that description.
[[nodiscard]] std::string introspectionOf(std::string_view description);

}  // namespace kyt
