// What the composition root asks about its own process.
#pragma once

#include <cstdint>
#include <string>

namespace kyt {

// Opens the null device in the place of standard input, output and error that are closed: what is opened later would
// take their numbers, and lines for people would be written into it.
void fillStandardDescriptors();
// The folder of the running program, absolute; empty when the system does not tell.
[[nodiscard]] std::string executableFolder();
// The path made absolute against the current folder; empty stays empty.
[[nodiscard]] std::string absolutePath(const std::string& path);
// The folder that a file is in.
[[nodiscard]] std::string folderOf(const std::string& path);
[[nodiscard]] uint32_t currentUser();
// What the kernel says of this process now; 0 where it says nothing. Any thread.
struct OwnFigures {
  int32_t pid = 0;
  uint64_t residentBytes = 0, anonymousBytes = 0;
  uint32_t threads = 0;
};
[[nodiscard]] OwnFigures ownFigures();
// Large blocks (a file that is uploaded, a server's long reply) go back to the system when they are freed. Left to
// itself the allocator keeps more and more of them, for each of its threads, after the first few.
void giveLargeBlocksBack();
// The allocator has at most four heaps that threads share, in place of eight for each processor: each keeps some half a
// megabyte that is in use here and there. To be called before there are threads.
void shareHeaps();
// All free memory that the allocator keeps goes back to the system: for a moment of quiet, since it looks through all of
// it. Any thread.
void giveFreeMemoryBack();

}  // namespace kyt
