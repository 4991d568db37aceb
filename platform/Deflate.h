// The four deflate calls that payload compression makes, as a port, so that each failure can be provoked. Result codes
// are zlib's (0 OK, 1 stream end, negative errors). One object is one stream; one thread at a time; never blocks.
#pragma once

#include <cstddef>
#include <memory>
#include <span>

namespace kyt {

class DeflateStream {
 public:
  virtual ~DeflateStream() = default;
  // deflateInit2_: method deflated, the default strategy.
  [[nodiscard]] virtual int initialize(int level, int windowBits, int memoryLevel) = 0;
  [[nodiscard]] virtual size_t bound(size_t inputLength) = 0;
  // deflate with the finish flag: consumes from the rest of `input`, writes at out; both advance.
  [[nodiscard]] virtual int finish(std::span<const std::byte>& input, std::span<std::byte>& output) = 0;
  virtual void end() = 0;
  // The stream's own message, or null.
  [[nodiscard]] virtual const char* message() const = 0;
};

class Deflate {
 public:
  virtual ~Deflate() = default;
  [[nodiscard]] virtual std::unique_ptr<DeflateStream> newStream() = 0;
};

}  // namespace kyt
