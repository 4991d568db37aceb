// Small files read whole. For configuration, user defaults and bundles: a few
// KiB each.
#pragma once

#include <sys/stat.h>

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <variant>

#include "platform/linux/base/Descriptors.h"

namespace kyt {

// What tells one state of a file from another without reading it.
struct FileIdentity {
  uint64_t device = 0, inode = 0;
  int64_t size = -1;  // -1: there is no such file
  int64_t changedSeconds = 0, changedNanoseconds = 0, modifiedSeconds = 0, modifiedNanoseconds = 0;
  uint32_t owner = 0, mode = 0;
  [[nodiscard]] bool exists() const { return size >= 0; }
  friend bool operator==(const FileIdentity&, const FileIdentity&) = default;
};
[[nodiscard]] FileIdentity identityOf(const struct stat& status);
[[nodiscard]] FileIdentity identityOf(const std::string& path);  // follows symbolic links

// A change within the same tick of the kernel's clock as the last one leaves no trace in the times, so what
// was read from a file that changed this recently must be read again next time.
[[nodiscard]] bool changedJustNow(const FileIdentity& identity);

struct FileContents {
  std::string bytes;
  FileIdentity identity;
};
struct ReadProblem {
  std::string text;  // the system's word, "is no regular file", "is too large"
  int error = 0;     // errno; 0: the file was seen, and is not what is wanted
};
[[nodiscard]] std::variant<FileContents, ReadProblem> readRegularFile(const std::string& path,
                                                                      size_t maxBytes);
// Whether such a failure says nothing about the file: the machine lacked something (descriptors, memory, an answer of
// its disk), and the next attempt may succeed.
[[nodiscard]] bool isMomentary(int error);

// Makes a folder and its missing parents (mode 0755 for parents). No value: it is there now.
[[nodiscard]] std::optional<std::string> makeFolders(const std::string& path, uint32_t mode);
// All bytes, through interruptions. False: errno says why.
[[nodiscard]] bool writeAll(int fd, std::string_view bytes);
[[nodiscard]] std::string errorText(int error);

}  // namespace kyt
