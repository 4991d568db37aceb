// Whether kernels that died left word of a panic in persistent memory (pstore), where the last lines stay that no longer
// reached the disk. One thread.
//
// The first line of each dump says why it was written: "Panic#1 Part1", or "Oops#1 Part1" where the system went on. A dump
// in /sys/fs/pstore has the time at which it was written, if the memory keeps that. systemd-pstore moves dumps early in the
// next run, to /var/lib/systemd/pstore, and there they have the time of the move.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace kyt::sources {

struct PanicDumps {
  std::vector<uint64_t> written;  // when, in microseconds since 1970; 0 where that is not known
  std::vector<uint64_t> moved;    // when systemd-pstore found one
};
// `root` stands in front of both folders. Folders and dumps that cannot be read are passed over; at most kMostDumps of each.
inline constexpr size_t kMostDumps = 200;
[[nodiscard]] PanicDumps panicDumps(const std::string& root);

}  // namespace kyt::sources
