#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <system_error>

#include "tools/StorebagFile.h"

namespace kyt::tools {

namespace {

constexpr size_t kMostBytes = 64u << 20;

Error failure(const std::string& path) {
  return Error{"KYTToolsErrorDomain", errno, path + ": " + std::strerror(errno)};
}

bool writeAll(int fd, std::string_view bytes) {
  while (!bytes.empty()) {
    const ssize_t written = write(fd, bytes.data(), bytes.size());
    if (written < 0 && errno == EINTR) continue;
    if (written < 0) return false;
    bytes.remove_prefix(static_cast<size_t>(written));
  }
  return true;
}

// The names of devices and of open files: /dev/stdout leads to a file that is not to be replaced, nor is the link itself.
bool isInFolderOfDevices(const std::string& path) {
  std::error_code error;
  const std::string folder =
      std::filesystem::canonical(std::filesystem::absolute(path, error).parent_path(), error).string();
  return !error && (folder == "/dev" || (folder + "/").starts_with("/proc/"));
}

std::optional<Error> writeInto(const std::string& path, std::string_view bytes) {
  const int fd = open(path.c_str(), O_WRONLY | O_APPEND | O_CLOEXEC | O_NOCTTY);
  if (fd < 0) return failure(path);
  std::optional<Error> error;
  if (!writeAll(fd, bytes)) error = failure(path);
  close(fd);
  return error;
}

}  // namespace

std::variant<std::string, Error> readFile(const std::string& path) {
  const int fd = path == "-" ? dup(STDIN_FILENO) : open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return failure(path);
  std::string out;
  char buffer[65536];
  for (;;) {
    const ssize_t got = read(fd, buffer, sizeof buffer);
    if (got < 0 && errno == EINTR) continue;
    if (got < 0) {
      Error error = failure(path);
      close(fd);
      return error;
    }
    if (got == 0) break;
    out.append(buffer, static_cast<size_t>(got));
    if (out.size() > kMostBytes) {
      errno = EFBIG;  // or a device without an end
      Error error = failure(path);
      close(fd);
      return error;
    }
  }
  close(fd);
  return out;
}

std::optional<Error> writeFile(const std::string& path, std::string_view bytes, unsigned mode) {
  struct stat there = {};
  const Error irregular{"KYTToolsErrorDomain", 1, path + " is no regular file"};
  if (stat(path.c_str(), &there) == 0 && S_ISBLK(there.st_mode))
    return irregular;  // a disk, by whatever name
  if (isInFolderOfDevices(path)) return writeInto(path, bytes);
  if (lstat(path.c_str(), &there) == 0) {
    if (S_ISCHR(there.st_mode)) return writeInto(path, bytes);
    if (S_ISFIFO(there.st_mode) || S_ISSOCK(there.st_mode)) return irregular;
  }
  std::string temporary = path + ".XXXXXX";
  const int fd = mkostemp(temporary.data(), O_CLOEXEC);
  if (fd < 0) return failure(path);
  const bool done = fchmod(fd, mode) == 0 && writeAll(fd, bytes) && fsync(fd) == 0;
  std::optional<Error> error;
  if (!done) error = failure(path);
  close(fd);
  if (!error && std::rename(temporary.c_str(), path.c_str()) != 0) error = failure(path);
  if (error) unlink(temporary.c_str());
  return error;
}

}  // namespace kyt::tools
