// What the posts of a run must cost at least, as far as this machine goes: the daemon's own JSON writer and the quickest
// compressor whose output is as small, over the records that arrived, with the compressor's state kept from one body to
// the next. One thread.
#pragma once

#include <cstddef>
#include <string>
#include <vector>

namespace kyt::bench {

struct ReferenceFigures {
  double secondsPerRecord = 0;     // processor time
  double secondsWithZlib = 0;      // of a record, with zlib's default level in its place
  std::string compressor;          // library and level
  double jsonBytesPerRecord = 0;   // before compression
  double bytesPerRecord = 0;       // of the bodies that arrived
  double floorBytesPerRecord = 0;  // of those that the reference makes
  size_t records = 0, keysPerRecord = 0;
};
// `bodies` as they were posted, gzip or not. Takes at least some twice `seconds`. All null where no body holds an event.
[[nodiscard]] ReferenceFigures measureReference(const std::vector<std::string>& bodies, double seconds = 0.7);

}  // namespace kyt::bench
