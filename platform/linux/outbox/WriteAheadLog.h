// SQLite's write-ahead log as it lies on disk, so far as to tell how much of it was whole once. SQLite itself reads it up to
// the first frame whose checksum is wrong, and takes the rest for what was never finished.
#pragma once

#include <cstdint>
#include <string>

namespace kyt {

// The number of the last frame that ends a change and follows upon its predecessor; 0: there is none, or no such file.
[[nodiscard]] uint64_t lastWholeFrame(const std::string& log);

}  // namespace kyt
