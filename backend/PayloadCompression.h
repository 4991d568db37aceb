// Compression of a whole buffer in memory, for request bodies. Any thread; never blocks. The output buffer is
// sized once by the bound for the input and never grown.
#pragma once

#include <optional>

#include "platform/Cryptography.h"
#include "platform/objects/Value.h"

namespace kyt {

struct Platform;

// The complete gzip stream (or zlib stream, when `gzip` is not set) of the input; none for an empty input and
// on failure, with one line in the log.
[[nodiscard]] std::optional<Data> compressDataWithZlibOrGzip(Platform& platform, bool gzip, Bytes input);
[[nodiscard]] std::optional<Data> gzipDeflate(Platform& platform, Bytes input);

}  // namespace kyt
