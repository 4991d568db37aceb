// Deflate compression as payload compression asks for it: zlib's four calls, as a port, so that each failure can be
// provoked and another library can stand in zlib's place. Result codes are zlib's, whichever library is behind. One
// object is one stream; one thread at a time; never blocks.
#pragma once

#include <cstddef>
#include <memory>
#include <span>

namespace kyt {

struct DeflateCode {
  static constexpr int ok = 0;
  static constexpr int streamEnd = 1;
  static constexpr int fileError = -1;
  static constexpr int streamError = -2;
  static constexpr int dataError = -3;
  static constexpr int memoryError = -4;
  static constexpr int bufferError = -5;
  static constexpr int versionError = -6;
};

inline constexpr int kDeflateDefaultLevel = -1;  // the one that the library's object was made with

class DeflateStream {
 public:
  virtual ~DeflateStream() = default;
  // deflateInit2_: method deflated, the default strategy. Levels are 1 to 9 and kDeflateDefaultLevel; window bits 15 make a
  // zlib stream, 31 a gzip stream. A library that manages its memory in another way has no use for the memory level.
  [[nodiscard]] virtual int initialize(int level, int windowBits, int memoryLevel) = 0;
  // So much room is enough for one call of finish(), whatever the input is.
  [[nodiscard]] virtual size_t bound(size_t inputLength) = 0;
  // deflate with the finish flag: consumes from the rest of `input`, writes at out; both advance. Where there is less room
  // than the bound, the result is streamEnd all the same, ok (there is more to write), or a bufferError.
  [[nodiscard]] virtual int finish(std::span<const std::byte>& input, std::span<std::byte>& output) = 0;
  virtual void end() = 0;
  // The stream's own message, or null.
  [[nodiscard]] virtual const char* message() const = 0;
};

class Deflate {
 public:
  virtual ~Deflate() = default;
  // The stream must not outlive this object. Any thread.
  [[nodiscard]] virtual std::unique_ptr<DeflateStream> newStream() = 0;
};

}  // namespace kyt
