#include "platform/linux/data/ZlibDeflate.h"

#include <zlib.h>

#include <algorithm>
#include <climits>
#include <cstddef>
#include <cstdlib>
#include <functional>
#include <new>

namespace kyt {
namespace {

class ZlibStream : public DeflateStream {
 public:
  ZlibStream(Spares<ZlibDeflate::Workspace>& workspaces, int level)
      : workspaces_(workspaces), defaultLevel_(level) {
    stream_.zalloc = allocate;
    stream_.zfree = release;
    stream_.opaque = this;
  }
  ZlibStream(const ZlibStream&) = delete;
  ZlibStream& operator=(const ZlibStream&) = delete;
  ~ZlibStream() override { end(); }

  int initialize(int level, int windowBits, int memoryLevel) override {
    end();
    workspace_ = workspaces_.take();
    if (workspace_ == nullptr) workspace_.reset(new (std::nothrow) std::byte[ZlibDeflate::kWorkspaceBytes]);
    used_ = 0;
    if (level == kDeflateDefaultLevel) level = defaultLevel_;
    const int result = deflateInit2(&stream_, level, Z_DEFLATED, windowBits, memoryLevel, Z_DEFAULT_STRATEGY);
    initialized_ = result == Z_OK;
    if (!initialized_) workspaces_.giveBack(std::move(workspace_));
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
    if (!initialized_) return;
    deflateEnd(&stream_);
    workspaces_.giveBack(std::move(workspace_));
    initialized_ = false;
  }

  [[nodiscard]] const char* message() const override { return stream_.msg; }

 private:
  // zlib allocates all it needs in deflateInit2: from the workspace, one piece after the other, or from the
  // heap what does not fit (larger settings than the usual).
  static void* allocate(void* opaque, uInt items, uInt size) {
    auto& self = *static_cast<ZlibStream*>(opaque);
    constexpr size_t kAlignment = alignof(std::max_align_t);
    const size_t bytes = (size_t{items} * size + kAlignment - 1) / kAlignment * kAlignment;
    if (self.workspace_ == nullptr || bytes > ZlibDeflate::kWorkspaceBytes - self.used_)
      return std::malloc(bytes);
    void* piece = self.workspace_.get() + self.used_;
    self.used_ += bytes;
    return piece;
  }
  static void release(void* opaque, void* piece) {
    const std::byte* begin = static_cast<ZlibStream*>(opaque)->workspace_.get();
    const auto* place = static_cast<const std::byte*>(piece);
    const std::less<> before;  // a total order, also between unrelated blocks
    const bool inside =
        begin != nullptr && !before(place, begin) && before(place, begin + ZlibDeflate::kWorkspaceBytes);
    if (!inside) std::free(piece);
  }

  Spares<ZlibDeflate::Workspace>& workspaces_;
  const int defaultLevel_;
  ZlibDeflate::Workspace workspace_;
  size_t used_ = 0;  // of the workspace
  z_stream stream_{};
  bool initialized_ = false;
};

}  // namespace

std::unique_ptr<DeflateStream> ZlibDeflate::newStream() {
  return std::make_unique<ZlibStream>(workspaces_, level_);
}

}  // namespace kyt
