#include "platform/linux/data/LibdeflateDeflate.h"

#include <libdeflate.h>

#include <utility>

#include "platform/linux/base/SharedLibrary.h"

namespace kyt {

struct LibdeflateDeflate::Library {
  decltype(::libdeflate_alloc_compressor)* make = nullptr;
  decltype(::libdeflate_free_compressor)* free = nullptr;
  decltype(::libdeflate_gzip_compress)* gzip = nullptr;
  decltype(::libdeflate_zlib_compress)* zlib = nullptr;
  decltype(::libdeflate_gzip_compress_bound)* gzipBound = nullptr;
  decltype(::libdeflate_zlib_compress_bound)* zlibBound = nullptr;
};

namespace {

constexpr int kZlibWindowBits = 15;
constexpr int kGzipWindowBits = 31;

class LibdeflateStream : public DeflateStream {
 public:
  LibdeflateStream(const LibdeflateDeflate::Library& library,
                   Spares<LibdeflateDeflate::Compressor>& compressors, int level)
      : library_(library), compressors_(compressors), defaultLevel_(level) {}
  LibdeflateStream(const LibdeflateStream&) = delete;
  LibdeflateStream& operator=(const LibdeflateStream&) = delete;
  ~LibdeflateStream() override { end(); }

  int initialize(int level, int windowBits, int memoryLevel) override {
    end();
    if (level == kDeflateDefaultLevel) level = defaultLevel_;
    const bool known = level >= 1 && level <= 9 && memoryLevel >= 1 && memoryLevel <= 9 &&
                       (windowBits == kZlibWindowBits || windowBits == kGzipWindowBits);
    if (!known) return DeflateCode::streamError;
    ofDefaultLevel_ = level == defaultLevel_;
    gzip_ = windowBits == kGzipWindowBits;
    if (ofDefaultLevel_) compressor_ = compressors_.take();
    if (compressor_ == nullptr)
      compressor_ = LibdeflateDeflate::Compressor(library_.make(level), {library_.free});
    return compressor_ != nullptr ? DeflateCode::ok : DeflateCode::memoryError;
  }

  size_t bound(size_t inputLength) override {
    return (gzip_ ? library_.gzipBound : library_.zlibBound)(compressor_.get(), inputLength);
  }

  // All or nothing.
  int finish(std::span<const std::byte>& input, std::span<std::byte>& output) override {
    if (compressor_ == nullptr || output.empty()) return DeflateCode::streamError;
    const size_t size = (gzip_ ? library_.gzip : library_.zlib)(compressor_.get(), input.data(), input.size(),
                                                                output.data(), output.size());
    if (size == 0) return DeflateCode::bufferError;
    input = input.subspan(input.size());
    output = output.subspan(size);
    return DeflateCode::streamEnd;
  }

  void end() override {
    if (ofDefaultLevel_) compressors_.giveBack(std::move(compressor_));
    compressor_ = nullptr;
  }

  [[nodiscard]] const char* message() const override { return nullptr; }

 private:
  const LibdeflateDeflate::Library& library_;
  Spares<LibdeflateDeflate::Compressor>& compressors_;
  const int defaultLevel_;
  LibdeflateDeflate::Compressor compressor_;
  bool ofDefaultLevel_ = false, gzip_ = false;
};

}  // namespace

std::variant<std::unique_ptr<LibdeflateDeflate>, std::string> LibdeflateDeflate::load(int level,
                                                                                      const char* file) {
  SharedLibrary shared(file);
  auto library = std::make_unique<Library>();
  shared.resolve(library->make, "libdeflate_alloc_compressor");
  shared.resolve(library->free, "libdeflate_free_compressor");
  shared.resolve(library->gzip, "libdeflate_gzip_compress");
  shared.resolve(library->zlib, "libdeflate_zlib_compress");
  shared.resolve(library->gzipBound, "libdeflate_gzip_compress_bound");
  shared.resolve(library->zlibBound, "libdeflate_zlib_compress_bound");
  if (shared.problem()) return *shared.problem();
  return std::unique_ptr<LibdeflateDeflate>(new LibdeflateDeflate(std::move(library), level));
}

LibdeflateDeflate::LibdeflateDeflate(std::unique_ptr<const Library> library, int level)
    : library_(std::move(library)), level_(level) {}

LibdeflateDeflate::~LibdeflateDeflate() = default;

std::unique_ptr<DeflateStream> LibdeflateDeflate::newStream() {
  return std::make_unique<LibdeflateStream>(*library_, compressors_, level_);
}

}  // namespace kyt
