// libdeflate behind the port: it compresses a whole buffer at once, in about a quarter of zlib's time. It is loaded when
// the daemon starts with it, so a system without it is served by zlib.
//
// A compressor holds some hundred KiB that libdeflate makes for one level; it is used again for the next body, and few
// are kept, as zlib's workspaces are.
#pragma once

#include <cstddef>
#include <memory>
#include <string>
#include <variant>

#include "platform/Deflate.h"
#include "platform/linux/data/Spares.h"

struct libdeflate_compressor;

namespace kyt {

class LibdeflateDeflate : public Deflate {
 public:
  static constexpr char kFile[] = "libdeflate.so.0";
  static constexpr size_t kMostKept = 3;

  // Loads the library, which may read files, or says why it cannot be used. `level` is what kDeflateDefaultLevel stands
  // for: 1 to 9.
  [[nodiscard]] static std::variant<std::unique_ptr<LibdeflateDeflate>, std::string> load(
      int level, const char* file = kFile);
  LibdeflateDeflate(const LibdeflateDeflate&) = delete;
  LibdeflateDeflate& operator=(const LibdeflateDeflate&) = delete;
  ~LibdeflateDeflate() override;
  [[nodiscard]] std::unique_ptr<DeflateStream> newStream() override;
  [[nodiscard]] size_t kept() const { return compressors_.kept(); }

  struct Library;  // its functions
  struct Free {
    void (*free)(libdeflate_compressor*) = nullptr;
    void operator()(libdeflate_compressor* compressor) const { free(compressor); }
  };
  using Compressor = std::unique_ptr<libdeflate_compressor, Free>;

 private:
  LibdeflateDeflate(std::unique_ptr<const Library> library, int level);

  const std::unique_ptr<const Library> library_;
  const int level_;
  Spares<Compressor> compressors_{kMostKept};
};

}  // namespace kyt
