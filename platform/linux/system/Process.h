// What the composition root asks about its own process.
#pragma once

#include <cstdint>
#include <string>

namespace kyt {

// The folder of the running program, absolute; empty when the system does not tell.
[[nodiscard]] std::string executableFolder();
// The path made absolute against the current folder; empty stays empty.
[[nodiscard]] std::string absolutePath(const std::string& path);
// The folder that a file is in.
[[nodiscard]] std::string folderOf(const std::string& path);
[[nodiscard]] uint32_t currentUser();
// Large blocks (a file that is uploaded, a server's long reply) go back to the system when they are freed. Left to
// itself the allocator keeps more and more of them, for each of its threads, after the first few.
void giveLargeBlocksBack();

}  // namespace kyt
