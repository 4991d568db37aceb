// The journal's own socket, to which an entry is one datagram: a line for each field, "NAME=value". libsystemd's function
// waits while the journal takes nothing; this socket never blocks. Used by the log's sink and the power log, which see to
// it that their fields have no line breaks.
#pragma once

#include <memory>
#include <string_view>

#include "platform/linux/files/Files.h"

namespace kyt {

class JournalSocket {
 public:
  // Whether there is one to connect to.
  [[nodiscard]] static bool isThere();
  // Null where it cannot be connected to, with errno as it was. Shared: a LineWriter's thread may outlive the sink.
  [[nodiscard]] static std::shared_ptr<JournalSocket> open();

  [[nodiscard]] int descriptor() const { return socket_.get(); }
  // To a journal that was started anew.
  [[nodiscard]] bool connectAgain();
  // An entry that is too large for a datagram (EMSGSIZE), in a sealed file of memory. Whether it was taken.
  [[nodiscard]] bool sendInFile(std::string_view entry);

 private:
  explicit JournalSocket(Descriptor socket) : socket_(std::move(socket)) {}
  const Descriptor socket_;
};

}  // namespace kyt
