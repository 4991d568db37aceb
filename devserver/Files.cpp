#include "devserver/Files.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <fstream>
#include <sstream>

namespace kyt::devserver {
namespace {

bool writeAll(int descriptor, std::string_view content) {
  while (!content.empty()) {
    const ssize_t count = write(descriptor, content.data(), content.size());
    if (count < 0 && errno == EINTR) continue;
    if (count <= 0) return false;
    content.remove_prefix(static_cast<size_t>(count));
  }
  return true;
}

}  // namespace

std::optional<std::string> readFile(const std::filesystem::path& path, size_t limit) {
  const int descriptor = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (descriptor < 0) return std::nullopt;
  std::string content;
  char block[65536];
  ssize_t count = 0;
  while ((count = read(descriptor, block, sizeof block)) != 0) {
    if (count < 0 && errno == EINTR) continue;
    if (count < 0 || content.size() + static_cast<size_t>(count) > limit) break;
    content.append(block, static_cast<size_t>(count));
  }
  close(descriptor);
  if (count != 0) return std::nullopt;
  return content;
}

bool replaceFile(const std::filesystem::path& path, std::string_view content, mode_t mode) {
  const std::string temporary = path.string() + ".new." + std::to_string(getpid());
  unlink(temporary.c_str());
  const int descriptor = open(temporary.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, mode);
  if (descriptor < 0) return false;
  const bool written = writeAll(descriptor, content) && fchmod(descriptor, mode) == 0;
  close(descriptor);
  if (written && rename(temporary.c_str(), path.c_str()) == 0) return true;
  const int error = errno;
  unlink(temporary.c_str());
  errno = error;
  return false;
}

}  // namespace kyt::devserver
