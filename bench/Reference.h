// The reference for posting: RapidJSON's writer and zlib, alone, on the records that the daemon really
// posted.
#pragma once

#include <string>
#include <vector>

namespace kyt::bench {

struct ReferenceFigures {
  size_t records = 0, batches = 0;
  double secondsPerRecord = 0;  // writer and deflate, processor time
  double jsonBytesPerRecord = 0, ratio = 0;
  size_t keysPerRecord = 0;
};
// `bodies`: posts as they came (gzip). Repeats until about a second was spent.
[[nodiscard]] ReferenceFigures measureReference(const std::vector<std::string>& bodies);

}  // namespace kyt::bench
