// The filter of system calls that the kernel applies to a confined process (seccomp), made with libseccomp:
// the one seam to that library. Used by LinuxConfinement.
//
// The profile becomes two or three filters, since the kernel's record of refusals is switched for a whole
// filter. The first holds the lists and leaves a record of each refusal. The second answers calls of which
// libraries only find out whether they are there (ENOSYS), without a record: threads start with such a call.
// The third is entered when the start is over, and takes away what only the start needs. Where several say
// something of a call, the strictest counts.
//
// A call that a filter allows whatever its arguments costs no look into it: the kernel (5.11 and newer) keeps
// a table of those. Calls whose arguments are looked at are sorted as a binary tree.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/linux/confinement/SystemCallRules.h"

namespace kyt {

inline constexpr int kEndsTheProcess = 0;  // instead of an error's number

struct SystemCallProfile {
  int otherwise = 0;  // the error of a call that no list names, or kEndsTheProcess
  std::vector<SystemCallRule> allow;
  std::vector<SystemCallRule> untilListening;         // allowed until the start is over
  std::vector<SystemCallRule> kill;                   // end the process
  std::map<int, std::vector<SystemCallRule>> errors;  // fail with another error, without a record
};

// Before the start is over. No value: entered, for the calling thread and the threads that it starts. Otherwise why
// not. Precondition: no_new_privs is set.
[[nodiscard]] std::optional<std::string> enterSystemCallFilter(const SystemCallProfile& profile);
// From now on what stands in `untilListening` fails with EPERM.
[[nodiscard]] std::optional<std::string> endStartOfSystemCallFilter(const SystemCallProfile& profile);

// The call's number, negative when this architecture has none of that name; no value: there is no such call.
[[nodiscard]] std::optional<int> systemCallNumber(const std::string& name);

}  // namespace kyt
