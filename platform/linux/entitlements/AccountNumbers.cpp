#include "platform/linux/entitlements/AccountNumbers.h"

#include <fcntl.h>
#include <grp.h>
#include <pwd.h>
#include <unistd.h>

#include <cerrno>
#include <memory>

#include "platform/linux/files/Files.h"

namespace kyt {
namespace {

template <typename Entry, typename System>
int lookUp(const std::string& name, System system, uint32_t Entry::*number, std::optional<uint32_t>& found) {
  for (size_t size = 4096; size <= 1u << 20; size *= 4) {
    const auto buffer = std::make_unique<char[]>(size);
    Entry entry = {};
    Entry* result = nullptr;
    const int error = system(name.c_str(), &entry, buffer.get(), size, &result);
    if (error == ERANGE) continue;
    if (error == 0 && result != nullptr) found = result->*number;
    return error;
  }
  return 0;
}

// Where several sources are asked (nsswitch.conf), one that knows of nobody hides that another could not be read: then
// nobody has the name, and there is no error. So its file is opened to see. 0: it can be, or there is none.
int refusalToOpen(const char* file) {
  const int opened = ::open(file, O_RDONLY | O_CLOEXEC);
  if (opened < 0) return isMomentary(errno) ? errno : 0;
  ::close(opened);
  return 0;
}

int lookUpUser(const std::string& name, std::optional<uint32_t>& found) {
  const int error = lookUp<passwd>(name, ::getpwnam_r, &passwd::pw_uid, found);
  return error == 0 && !found ? refusalToOpen("/etc/passwd") : error;
}

int lookUpGroup(const std::string& name, std::optional<uint32_t>& found) {
  const int error = lookUp<struct group>(name, ::getgrnam_r, &group::gr_gid, found);
  return error == 0 && !found ? refusalToOpen("/etc/group") : error;
}

}  // namespace

AccountNumbers::AccountNumbers() : AccountNumbers(lookUpUser, lookUpGroup) {}
AccountNumbers::AccountNumbers(LookUp users, LookUp groups) : users_(users), groups_(groups) {}

std::optional<uint32_t> AccountNumbers::Remembered::numberOf(const NameOrNumber& who) {
  if (const auto* known = std::get_if<int64_t>(&who)) {
    // The last number stands for nobody in system calls, and for a peer of which nothing is known.
    if (*known >= int64_t{UINT32_MAX}) return std::nullopt;
    return static_cast<uint32_t>(*known);
  }
  const std::string& name = std::get<std::string>(who);
  std::optional<uint32_t> found;
  const int error = lookUp_(name, found);
  MutexLock lock(mutex_);
  const auto known = numbers_.find(name);
  if (isMomentary(error)) return known != numbers_.end() ? std::optional(known->second) : std::nullopt;
  if (!found) {
    if (known != numbers_.end()) numbers_.erase(known);
    return std::nullopt;
  }
  if (known == numbers_.end() && numbers_.size() >= kMostRemembered) numbers_.clear();
  numbers_[name] = *found;
  return found;
}

std::optional<uint32_t> AccountNumbers::user(const NameOrNumber& user) {
  return users_.numberOf(user);
}

std::optional<uint32_t> AccountNumbers::group(const NameOrNumber& group) {
  return groups_.numberOf(group);
}

}  // namespace kyt
