// The few file operations that local message log files need. Paths are absolute, names are bytes as the file
// system has them. Any thread, several at once; every operation may block for the file system. Nothing is
// kept open between two calls.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "platform/base/Error.h"
#include "platform/objects/Value.h"

namespace kyt {

// The domain of these errors; the code is the one below or the system's own number of the error.
inline constexpr char kKYTFileErrorDomain[] = "KYTFileErrorDomain";
inline constexpr int32_t kFileErrorNoSuchFile = 260;

struct FileAttributes {
  bool isRegularFile = false;
  std::optional<Date> creationDate;  // the earlier of birth and last modification: a restored file is old
  uint64_t size = 0;
};

class FileManager {
 public:
  virtual ~FileManager() = default;
  // The names in a folder, in no order.
  [[nodiscard]] virtual std::variant<std::vector<std::string>, Error> contentsOfDirectory(
      const std::string& path) = 0;
  // None when there is nothing, or nothing can be learnt of it. Symbolic links are not followed.
  [[nodiscard]] virtual std::optional<FileAttributes> attributesOfItem(const std::string& path) = 0;
  // With all that is missing above it. One that is there is no error.
  [[nodiscard]] virtual std::optional<Error> createDirectory(const std::string& path) = 0;
  // Empty, readable for the daemon's user alone. One that is there stays as it is, so that two callers who
  // start the same file lose nothing.
  [[nodiscard]] virtual std::optional<Error> createFile(const std::string& path) = 0;
  // To the end of a regular file that is there, whatever others append meanwhile. After an error some of the
  // bytes may have been written.
  [[nodiscard]] virtual std::optional<Error> append(const std::string& path, std::string_view bytes) = 0;
  // Removes a file.
  [[nodiscard]] virtual std::optional<Error> removeItem(const std::string& path) = 0;
};

}  // namespace kyt
