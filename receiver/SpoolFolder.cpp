#include "receiver/SpoolFolder.h"

#include <fcntl.h>
#include <sys/file.h>

#include <cerrno>

#include "platform/linux/files/Files.h"

namespace kyt::receiver {

std::optional<std::string> SpoolFolder::take() {
  isTaken_ = false;
  if (lock_.get() >= 0) return std::nullopt;
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
