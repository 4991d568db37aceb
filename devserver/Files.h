// Whole files, read and replaced. Any thread; blocks on the disk.
#pragma once

#include <sys/types.h>

#include <filesystem>
#include <optional>
#include <string>
#include <string_view>

namespace kyt::devserver {

// The content, or nothing when it cannot be read or is longer than `limit`.
[[nodiscard]] std::optional<std::string> readFile(const std::filesystem::path& path, size_t limit);

// Replaces the file in one step, so that no reader ever sees a part of it. False: errno says why.
[[nodiscard]] bool replaceFile(const std::filesystem::path& path, std::string_view content, mode_t mode);

}  // namespace kyt::devserver
