#include "platform/linux/files/LinuxFileManager.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <memory>

#include "platform/linux/files/Files.h"

namespace kyt {

namespace {

constexpr uint32_t kFolderMode = 0750;  // what was sent is nobody else's
constexpr mode_t kFileMode = 0600;      // what back ends answered shows what clients sent

struct CloseFolder {
  void operator()(DIR* folder) const { ::closedir(folder); }
};

Error fileError(int number) {
  const bool missing = number == ENOENT || number == ENOTDIR;
  return Error{kKYTFileErrorDomain, missing ? kFileErrorNoSuchFile : number, errorText(number)};
}

double secondsOf(const struct statx_timestamp& time) {
  return static_cast<double>(time.tv_sec) + time.tv_nsec / 1e9;
}

}  // namespace

std::variant<std::vector<std::string>, Error> LinuxFileManager::contentsOfDirectory(const std::string& path) {
  const std::unique_ptr<DIR, CloseFolder> folder(::opendir(path.c_str()));
  if (folder == nullptr) return fileError(errno);
  std::vector<std::string> names;
  for (;;) {
    errno = 0;
    const dirent* entry = ::readdir(folder.get());
    if (entry == nullptr) break;
    const std::string_view name(entry->d_name);
    if (name != "." && name != "..") names.emplace_back(name);
  }
  if (errno != 0) return fileError(errno);
  return names;
}

std::optional<FileAttributes> LinuxFileManager::attributesOfItem(const std::string& path) {
  struct statx status = {};
  constexpr unsigned kWanted = STATX_TYPE | STATX_SIZE | STATX_MTIME | STATX_BTIME;
  if (::statx(AT_FDCWD, path.c_str(), AT_SYMLINK_NOFOLLOW, kWanted, &status) != 0) return std::nullopt;
  FileAttributes attributes;
  attributes.isRegularFile = S_ISREG(status.stx_mode);
  attributes.size = status.stx_size;
  double created = secondsOf(status.stx_mtime);
  if ((status.stx_mask & STATX_BTIME) != 0) created = std::min(created, secondsOf(status.stx_btime));
  attributes.creationDate = Date{created};
  return attributes;
}

std::optional<Error> LinuxFileManager::createDirectory(const std::string& path) {
  if (auto text = makeFolders(path, kFolderMode)) return Error{kKYTFileErrorDomain, -1, std::move(*text)};
  return std::nullopt;
}

std::optional<Error> LinuxFileManager::createFile(const std::string& path) {
  const Descriptor file = ownDescriptor(
      ::open(path.c_str(), O_WRONLY | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC, kFileMode));
  if (!file) return fileError(errno);
  return std::nullopt;
}

std::optional<Error> LinuxFileManager::append(const std::string& path, std::string_view bytes) {
  const Descriptor file = ownDescriptor(
      ::open(path.c_str(), O_WRONLY | O_APPEND | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
  if (!file) return fileError(errno);
  struct stat status = {};
  if (::fstat(file.get(), &status) != 0) return fileError(errno);
  if (!S_ISREG(status.st_mode)) return fileError(EINVAL);
  if (!writeAll(file.get(), bytes)) return fileError(errno);
  return std::nullopt;
}

std::optional<Error> LinuxFileManager::removeItem(const std::string& path) {
  if (::unlink(path.c_str()) != 0) return fileError(errno);
  return std::nullopt;
}

}  // namespace kyt
