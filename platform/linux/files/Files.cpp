#include "platform/linux/files/Files.h"

#include <fcntl.h>
#include <time.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <system_error>

namespace kyt {

std::string errorText(int error) {
  return std::generic_category().message(error);
}

FileIdentity identityOf(const struct stat& status) {
  FileIdentity identity;
  identity.device = status.st_dev;
  identity.inode = status.st_ino;
  identity.size = status.st_size;
  identity.changedSeconds = status.st_ctim.tv_sec;
  identity.changedNanoseconds = status.st_ctim.tv_nsec;
  identity.modifiedSeconds = status.st_mtim.tv_sec;
  identity.modifiedNanoseconds = status.st_mtim.tv_nsec;
  identity.owner = status.st_uid;
  identity.mode = status.st_mode;
  return identity;
}

FileIdentity identityOf(const std::string& path) {
  struct stat status = {};
  return ::stat(path.c_str(), &status) == 0 ? identityOf(status) : FileIdentity{};
}

bool changedJustNow(const FileIdentity& identity) {
  constexpr double kLongestTick = 0.05;
  timespec now = {};
  ::clock_gettime(CLOCK_REALTIME, &now);
  const double age = static_cast<double>(now.tv_sec - identity.changedSeconds) +
                     static_cast<double>(now.tv_nsec - identity.changedNanoseconds) / 1e9;
  return age < kLongestTick;
}

namespace {

ReadProblem systemProblem(int error) {
  return ReadProblem{errorText(error), error};
}

}  // namespace

bool isMomentary(int error) {
  switch (error) {
    case EAGAIN:
    case EBUSY:
    case EINTR:
    case EIO:
    case EMFILE:
    case ENFILE:
    case ENOBUFS:
    case ENOMEM:
    case ESTALE:
    case ETIMEDOUT:
      return true;
    default:
      return false;
  }
}

std::variant<FileContents, ReadProblem> readRegularFile(const std::string& path, size_t maxBytes) {
  // Without O_NONBLOCK a named pipe in the file's place would hold the caller for ever.
  const Descriptor file = ownDescriptor(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
  if (!file) return systemProblem(errno);
  struct stat status = {};
  if (::fstat(file.get(), &status) != 0) return systemProblem(errno);
  if (!S_ISREG(status.st_mode)) return ReadProblem{"is no regular file"};
  FileContents contents;
  contents.identity = identityOf(status);
  char buffer[16384];
  while (true) {
    const ssize_t count = ::read(file.get(), buffer, sizeof buffer);
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return systemProblem(errno);
    if (count == 0) return contents;
    contents.bytes.append(buffer, static_cast<size_t>(count));
    if (contents.bytes.size() > maxBytes) return ReadProblem{"is too large"};
  }
}

std::optional<std::string> makeFolders(const std::string& path, uint32_t mode) {
  for (size_t slash = path.find('/', 1); slash != std::string::npos; slash = path.find('/', slash + 1)) {
    const std::string parent = path.substr(0, slash);
    if (::mkdir(parent.c_str(), 0755) != 0 && errno != EEXIST) {
      const int error = errno;
      // On a read-only or foreign parent mkdir may fail although the folder is there.
      struct stat status = {};
      if (::stat(parent.c_str(), &status) != 0) return parent + ": " + errorText(error);
    }
  }
  if (::mkdir(path.c_str(), mode) != 0 && errno != EEXIST) return path + ": " + errorText(errno);
  struct stat status = {};
  if (::stat(path.c_str(), &status) != 0) return path + ": " + errorText(errno);
  if (!S_ISDIR(status.st_mode)) return path + ": is no folder";
  return std::nullopt;
}

bool writeAll(int fd, std::string_view bytes) {
  while (!bytes.empty()) {
    const ssize_t count = ::write(fd, bytes.data(), bytes.size());
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return false;
    bytes.remove_prefix(static_cast<size_t>(count));
  }
  return true;
}

}  // namespace kyt
