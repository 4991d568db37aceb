// The compression library that the settings choose.
#pragma once

#include <memory>

#include "platform/Deflate.h"
#include "platform/base/Settings.h"
#include "platform/linux/data/LibdeflateDeflate.h"

namespace kyt {

class Log;

// zlib in the place of a libdeflate that cannot be loaded, which a line in the log tells. Never null. May read files.
[[nodiscard]] std::unique_ptr<Deflate> makeDeflate(const CompressionSettings& settings, Log& log,
                                                   const char* libdeflate = LibdeflateDeflate::kFile);

}  // namespace kyt
