#include "platform/linux/entitlements/EntitlementMatch.h"

#include <grp.h>
#include <poll.h>
#include <pwd.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <memory>

namespace kyt {
namespace {

// Names are looked up for every connection: a user may be made after the file was written.
template <typename Entry, typename Lookup>
std::optional<uint32_t> numberOf(const NameOrNumber& who, Lookup lookup, uint32_t Entry::*number) {
  if (const auto* known = std::get_if<int64_t>(&who)) {
    // The last number stands for nobody in system calls, and for a peer of which nothing is known.
    if (*known >= int64_t{UINT32_MAX}) return std::nullopt;
    return static_cast<uint32_t>(*known);
  }
  const std::string& name = std::get<std::string>(who);
  for (size_t size = 4096; size <= 1u << 20; size *= 4) {
    const auto buffer = std::make_unique<char[]>(size);
    Entry entry = {};
    Entry* found = nullptr;
    const int error = lookup(name.c_str(), &entry, buffer.get(), size, &found);
    if (error == ERANGE) continue;
    if (error != 0 || found == nullptr) return std::nullopt;
    return found->*number;
  }
  return std::nullopt;
}

}  // namespace

std::optional<uint32_t> userNumber(const NameOrNumber& user) {
  return numberOf<passwd>(user, ::getpwnam_r, &passwd::pw_uid);
}

std::optional<uint32_t> groupNumber(const NameOrNumber& group) {
  return numberOf<struct group>(group, ::getgrnam_r, &group::gr_gid);
}

bool EntitlementMatch::isUser(const NameOrNumber& user) const {
  return userNumber(user) == peer_.uid;
}

bool EntitlementMatch::isMember(const NameOrNumber& who) const {
  const auto group = groupNumber(who);
  return group && (*group == peer_.gid ||
                   std::find(peer_.groups.begin(), peer_.groups.end(), *group) != peer_.groups.end());
}

bool EntitlementMatch::isAlive() const {
  pollfd wanted = {peer_.pidfd.get(), POLLIN, 0};
  return peer_.pidfd.get() >= 0 && ::poll(&wanted, 1, 0) == 0;
}

EntitlementMatch::ProgramResult EntitlementMatch::runs(const std::string& executable) {
  ProgramResult result;
  if (peer_.pidfd.get() < 0) {
    lack_ = "the kernel does not tell which process is connected";
    return result;
  }
  struct stat status = {};
  if (::stat(executable.c_str(), &status) != 0) {
    result.program = Program::missing;
    result.error = errno;
    return result;
  }
  result.wanted = {status.st_dev, status.st_ino};
  if (!running_) running_ = inspector_.runningProgram(peer_.pid);
  if (const int* error = std::get_if<int>(&*running_)) {
    // A process that has ended, or is about to, is no lack of privilege.
    const bool ended = *error == ENOENT || !isAlive();
    result.program = ended ? Program::processEnded : Program::unknown;
    result.error = *error;
    if (!ended) lack_ = errorText(*error);
    return result;
  }
  result.running = std::get<ProgramIdentity>(*running_);
  // Alive after the look means that the number stood for this process when it was looked at.
  result.program = !isAlive()                        ? Program::processEnded
                   : result.running == result.wanted ? Program::matches
                                                     : Program::otherProgram;
  return result;
}

bool EntitlementMatch::matches(const EntitlementGrant& grant) {
  if (grant.user && !isUser(*grant.user)) return false;
  if (grant.group && !isMember(*grant.group)) return false;
  if (grant.securityLabel && !hasLabel(*grant.securityLabel)) return false;
  return !grant.executable || runs(*grant.executable).program == Program::matches;
}

}  // namespace kyt
