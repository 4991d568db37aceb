// A local stream socket as the IPC server sees it, and the socket that new ones come from. The real ones are
// in platform/linux/base/; tests use the real ones too, over socket pairs, and streams in memory.
//
// Nothing here blocks. One thread reads and one writes at a time, which may be two threads; the descriptor is
// closed at destruction.
#pragma once

#include <cstddef>
#include <memory>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Entitlements.h"
#include "platform/base/Descriptor.h"

namespace kyt {

enum class StreamStatus : uint8_t {
  ok,
  wouldBlock,
  ended,      // the peer will send no more
  failed,     // the socket is broken
  truncated,  // more descriptors came than a message may carry; those were lost
};

struct StreamResult {
  StreamStatus status = StreamStatus::ok;
  size_t bytes = 0;
};

class Stream {
 public:
  virtual ~Stream() = default;
  // Reads once, adding the descriptors that came with the bytes, which are closed when the program executes
  // another.
  [[nodiscard]] virtual StreamResult read(std::span<std::byte> buffer,
                                          std::vector<Descriptor>& descriptors) = 0;
  // Writes what the socket takes at once.
  [[nodiscard]] virtual StreamResult write(std::string_view bytes) = 0;
  // What the kernel recorded about the peer when it connected: the same answer each time.
  [[nodiscard]] virtual PeerCredentials peer() = 0;
  // For the reactor.
  [[nodiscard]] virtual int descriptor() const = 0;
};

enum class AcceptStatus : uint8_t {
  accepted,
  wouldBlock,
  retry,      // this one connection is gone already
  exhausted,  // no descriptors or memory left: try again later
  failed
};

class StreamAcceptor {
 public:
  virtual ~StreamAcceptor() = default;
  [[nodiscard]] virtual AcceptStatus accept(std::unique_ptr<Stream>& stream) = 0;
  [[nodiscard]] virtual int descriptor() const = 0;
};

}  // namespace kyt
