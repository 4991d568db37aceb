// The bytes that are to leave on a session's connection: messages and calls in the form of the wire, each with a serial
// of its own, and the descriptors that leave with a call's first byte. Serials go on over all connections of a session.
// The library's thread only.
#pragma once

#include <cstddef>
#include <cstdint>
#include <deque>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "client/Call.h"
#include "platform/base/Descriptor.h"
#include "platform/linux/client/ClientSocket.h"

namespace kyt::client {

class Output {
 public:
  Output();

  // A new connection: nothing but these bytes. With none: the connection has ended.
  void restart(std::string opening = {});

  // Each writes one at the end and returns its serial; none, and nothing is written, when it is larger than a megabyte
  // or nested too deeply.
  [[nodiscard]] std::optional<uint32_t> message(const MessageArguments& message);  // one way
  // A call whose extension can be passed (`passesDescriptors`) gives it up.
  [[nodiscard]] std::optional<uint32_t> call(Call& call, bool passesDescriptors);
  [[nodiscard]] std::optional<uint32_t> ping();
  // To a call of the daemon of which there is no such method.
  void refuse(uint32_t replySerial);

  // All that waits, since restart().
  [[nodiscard]] std::string_view waitingBytes() const { return std::string_view(bytes_).substr(at_); }
  [[nodiscard]] size_t waiting() const { return bytes_.size() - at_; }

  struct Written {
    bool any = false;
    bool ended = false;  // the connection has
  };
  // Writes what the socket takes.
  [[nodiscard]] Written writeTo(linux_client::ClientSocket& socket);

 private:
  struct Mark {  // descriptors that leave with the byte at this offset
    size_t offset = 0;
    std::vector<Descriptor> descriptors;
  };

  const std::string messageHeader_;  // of all messages
  std::string bytes_;
  size_t at_ = 0;  // what is before has been written
  std::deque<Mark> marks_;
  uint32_t serial_ = 0;
};

}  // namespace kyt::client
