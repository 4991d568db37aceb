// Finds the first message in a stream's bytes and checks its header. Used by the daemon's server on each
// connection's large reads and by the client library on what the daemon answers.
//
// No allocation, no state between calls but what a HeaderMemory holds, any thread. The bytes are hostile; a
// message is looked at in place, at any address, in either byte order. Everything in the header is checked:
// field types and padding, required fields, names, paths, signatures, lengths against the limit before anything
// else is believed. The body is checked by BodyReader, or by validateBody.
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <string_view>

#include "platform/ipc/Wire.h"

namespace kyt {

// A message as it lies in the stream's buffer; valid as long as those bytes, and until the HeaderMemory that it was
// read with is used again.
struct Message {
  wire::MessageType type = wire::MessageType::methodCall;
  uint8_t flags = 0;
  bool swapped = false;  // in the other byte order than this machine's
  uint32_t serial = 0;
  uint32_t replySerial = 0;  // 0: none
  uint32_t unixFds = 0;
  std::string_view path, interface, member, errorName, destination, sender, signature;
  std::span<const std::byte> body;
  [[nodiscard]] bool expectsReply() const {
    return type == wire::MessageType::methodCall && (flags & wire::kNoReplyExpected) == 0;
  }
};

enum class FrameStatus : uint8_t {
  complete,    // `size` bytes are the message
  incomplete,  // at least `size` bytes are needed in all before it is worth asking again
  skip,        // a message of a type that receivers must ignore: `size` bytes
  tooLong,     // its lengths say more than the limit; the stream cannot go on
  malformed    // the stream cannot go on
};

struct Frame {
  FrameStatus status = FrameStatus::incomplete;
  size_t size = wire::kFixedHeaderBytes;
  const char* problem = nullptr;  // what is malformed, for the log
};

// The last header of a stream. A client's calls mostly differ in nothing but their bodies: a header with the bytes of
// one that was found good is not parsed again.
class HeaderMemory {
 public:
  HeaderMemory() = default;
  HeaderMemory(const HeaderMemory&) = delete;
  HeaderMemory& operator=(const HeaderMemory&) = delete;

  // Fills in what the fields of the header say, which ends at `end`; returns what is wrong with it, or null.
  // `message` has its type and byte order.
  [[nodiscard]] const char* parse(const uint8_t* header, size_t end, Message& message);

 private:
  uint8_t bytes_[256];
  size_t end_ = 0;   // 0: none
  Message message_;  // its texts are in bytes_
};

// Looks at the beginning of `bytes`. `message` is filled when the answer is `complete`.
[[nodiscard]] Frame readMessage(std::span<const std::byte> bytes, uint64_t maxMessageBytes, Message& message,
                                HeaderMemory* memory = nullptr);

}  // namespace kyt
