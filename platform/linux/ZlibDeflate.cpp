#include "platform/linux/ZlibDeflate.h"

#include <zlib.h>

#include <algorithm>
#include <climits>

namespace kyt {
namespace {

class ZlibStream : public DeflateStream {
 public:
  ZlibStream() = default;
  ZlibStream(const ZlibStream&) = delete;
  ZlibStream& operator=(const ZlibStream&) = delete;
  ~ZlibStream() override { end(); }

  int initialize(int level, int windowBits, int memoryLevel) override {
    end();
    const int result = deflateInit2(&stream_, level, Z_DEFLATED, windowBits, memoryLevel, Z_DEFAULT_STRATEGY);
    initialized_ = result == Z_OK;
    return result;
  }

  size_t bound(size_t inputLength) override {
    return deflateBound(initialized_ ? &stream_ : nullptr, static_cast<uLong>(inputLength));
  }

  int finish(std::span<const std::byte>& input, std::span<std::byte>& output) override {
    if (!initialized_) return Z_STREAM_ERROR;
    const size_t in = std::min<size_t>(input.size(), UINT_MAX);
    const size_t out = std::min<size_t>(output.size(), UINT_MAX);
    // zlib reads only; its interface predates const.
    stream_.next_in = const_cast<Bytef*>(reinterpret_cast<const Bytef*>(input.data()));
    stream_.avail_in = static_cast<uInt>(in);
    stream_.next_out = reinterpret_cast<Bytef*>(output.data());
    stream_.avail_out = static_cast<uInt>(out);
    // Input past 4 GiB waits for the next call.
    const int result = deflate(&stream_, in == input.size() ? Z_FINISH : Z_NO_FLUSH);
    input = input.subspan(in - stream_.avail_in);
    output = output.subspan(out - stream_.avail_out);
    return result;
  }

  void end() override {
    if (initialized_) deflateEnd(&stream_);
    initialized_ = false;
  }

  [[nodiscard]] const char* message() const override { return stream_.msg; }

 private:
  z_stream stream_{};
  bool initialized_ = false;
};

}  // namespace

std::unique_ptr<DeflateStream> ZlibDeflate::newStream() {
  return std::make_unique<ZlibStream>();
}

}  // namespace kyt
