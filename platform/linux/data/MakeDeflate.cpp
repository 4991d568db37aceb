#include "platform/linux/data/MakeDeflate.h"

#include <string>
#include <utility>
#include <variant>

#include "platform/linux/data/ZlibDeflate.h"
#include "platform/queues/Log.h"

namespace kyt {

std::unique_ptr<Deflate> makeDeflate(const CompressionSettings& settings, Log& log, const char* libdeflate) {
  if (settings.library == CompressionLibrary::libdeflate) {
    auto loaded = LibdeflateDeflate::load(settings.level, libdeflate);
    if (auto* deflate = std::get_if<std::unique_ptr<LibdeflateDeflate>>(&loaded)) return std::move(*deflate);
    log.normal("main: Compressing with zlib instead of libdeflate: %s",
               std::get<std::string>(loaded).c_str());
  }
  return std::make_unique<ZlibDeflate>(settings.level);
}

}  // namespace kyt
