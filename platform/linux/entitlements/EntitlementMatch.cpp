#include "platform/linux/entitlements/EntitlementMatch.h"

#include <poll.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>

namespace kyt {

bool EntitlementMatch::isUser(const NameOrNumber& user) const {
  return numbers_.user(user) == peer_.uid;
}

bool EntitlementMatch::isMember(const NameOrNumber& who) const {
  const auto group = numbers_.group(who);
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
