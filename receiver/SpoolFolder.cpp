#include "receiver/SpoolFolder.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>

#include <cerrno>

#include "platform/linux/files/Files.h"

namespace kyt::receiver {

bool SpoolFolder::isOurs() const {
  struct stat held {};
  struct stat there {};
  if (lock_.get() < 0 || ::fstat(lock_.get(), &held) != 0) return false;
  // A disk that does not answer has not lost it.
  if (::stat((folder_ + "/lock").c_str(), &there) != 0) return errno != ENOENT && errno != ENOTDIR;
  return held.st_dev == there.st_dev && held.st_ino == there.st_ino;
}

std::optional<std::string> SpoolFolder::take() {
  isTaken_ = false;
  if (isOurs()) return std::nullopt;
  lock_ = Descriptor();
  if (auto wrong = makeFolders(folder_, 0700)) return wrong;
  const std::string file = folder_ + "/lock";
  Descriptor lock = ownDescriptor(::open(file.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600));
  if (lock.get() < 0) return file + ": " + errorText(errno);
  if (::flock(lock.get(), LOCK_EX | LOCK_NB) != 0) {
    isTaken_ = true;
    return "another receiver has the folder " + folder_;
  }
  lock_ = std::move(lock);
  return std::nullopt;
}

}  // namespace kyt::receiver
