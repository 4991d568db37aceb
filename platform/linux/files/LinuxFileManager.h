// The files of the system. A name that someone else made a symbolic link or a pipe is refused, so that the
// daemon neither writes through it nor waits for it.
#pragma once

#include "platform/FileManager.h"

namespace kyt {

class LinuxFileManager final : public FileManager {
 public:
  [[nodiscard]] std::variant<std::vector<std::string>, Error> contentsOfDirectory(
      const std::string& path) override;
  [[nodiscard]] std::optional<FileAttributes> attributesOfItem(const std::string& path) override;
  [[nodiscard]] std::optional<Error> createDirectory(const std::string& path) override;
  [[nodiscard]] std::optional<Error> createFile(const std::string& path) override;
  [[nodiscard]] std::optional<Error> append(const std::string& path, std::string_view bytes) override;
  [[nodiscard]] std::optional<Error> removeItem(const std::string& path) override;
};

}  // namespace kyt
