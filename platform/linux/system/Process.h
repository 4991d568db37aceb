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

}  // namespace kyt
