#include "backend/PayloadCompression.h"

#include "platform/Deflate.h"
#include "platform/Platform.h"
#include "platform/queues/Log.h"

namespace kyt {

namespace {

constexpr int kGzipWindowBits = 31;  // 32 KiB window, gzip wrapper
constexpr int kZlibWindowBits = 15;
constexpr int kMemoryLevel = 8;

const char* initializationErrorText(int code) {
  switch (code) {
    case DeflateCode::versionError:
      return "The version of zlib.h and the version of the library linked do not match.";
    case DeflateCode::memoryError:
      return "Insufficient memory.";
    case DeflateCode::streamError:
      return "Invalid parameter passed in to function.";
    default:
      return "Unknown error code.";
  }
}

const char* deflateErrorText(int code) {
  switch (code) {
    case DeflateCode::versionError:
      return "The version of zlib.h and the version of the library linked do not match.";
    case DeflateCode::bufferError:
      return "Ran out of output buffer for writing compressed bytes.";
    case DeflateCode::memoryError:
      return "Memory could not be allocated for processing.";
    case DeflateCode::dataError:
      return "The deflate data was invalid or incomplete.";
    case DeflateCode::streamError:
      return "The stream state was inconsistent (e.g., next_in or next_out was NULL).";
    case DeflateCode::fileError:
      return "Error occured while reading file.";
    default:
      return "Unknown error code.";
  }
}

const char* messageText(const DeflateStream* stream) {
  const char* message = stream != nullptr ? stream->message() : nullptr;
  return message != nullptr ? message : "(null)";
}

}  // namespace

std::optional<Data> compressDataWithZlibOrGzip(Platform& platform, bool gzip, Bytes input) {
  if (input.empty()) {
    platform.log.error("compressDataWithZlibOrGzip: Cannot compress empty Bytebuf");
    return std::nullopt;
  }
  const std::unique_ptr<DeflateStream> stream = platform.deflate.newStream();
  int code = DeflateCode::memoryError;
  if (stream != nullptr)
    code = stream->initialize(kDeflateDefaultLevel, gzip ? kGzipWindowBits : kZlibWindowBits, kMemoryLevel);
  if (code != DeflateCode::ok) {
    platform.log.error("compressDataWithZlibOrGzip: deflateInit2() Error: \"%s\" Message: \"%s\"",
                       initializationErrorText(code), messageText(stream.get()));
    return std::nullopt;
  }
  std::byte* buffer = nullptr;
  const Data bound = Data::uninitialized(stream->bound(input.size()), buffer);
  std::span<std::byte> space(buffer, bound.size());
  Bytes rest = input;
  do {
    code = stream->finish(rest, space);
  } while (code == DeflateCode::ok);
  if (code != DeflateCode::streamEnd) {
    platform.log.error(
        "compressDataWithZlibOrGzip: zlib error while attempting compression: \"%s\" Message: \"%s\"",
        deflateErrorText(code), messageText(stream.get()));
    stream->end();
    return std::nullopt;
  }
  stream->end();
  // A copy of the right size, since a request may wait long for its turn, and the bound is several times as
  // large.
  Data output(bound.bytes().first(bound.size() - space.size()));
  platform.log.normal("compressDataWithZlibOrGzip: Compressed file from %u to %u",
                      static_cast<unsigned>(input.size()), static_cast<unsigned>(output.size()));
  return output;
}

std::optional<Data> gzipDeflate(Platform& platform, Bytes input) {
  return compressDataWithZlibOrGzip(platform, true, input);
}

}  // namespace kyt
