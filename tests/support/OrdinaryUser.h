// Makes this process what a service manager starts: an ordinary user's, with a few capabilities that are ambient, so that
// programs it executes have them too. Root only, and for good: in a process of a test's own (ChildProcess.h).
#pragma once

#include <linux/capability.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cstdint>
#include <fstream>
#include <string>

#include "platform/linux/confinement/Capabilities.h"

namespace kyt {

// A user and a group that no machine has. All sets of capabilities are then `set`, which are of the first 32.
inline bool becomeOrdinaryUser(uint32_t id, CapabilitySet set) {
  for (int i = 0; i < 64; ++i)
    if ((set & capabilitySet(i)) == 0 && ::prctl(PR_CAPBSET_READ, i, 0, 0, 0) == 1 &&
        ::prctl(PR_CAPBSET_DROP, i, 0, 0, 0) != 0)
      return false;
  if (::prctl(PR_SET_KEEPCAPS, 1, 0, 0, 0) != 0) return false;
  if (::syscall(SYS_setgroups, 0, nullptr) != 0) return false;
  if (::syscall(SYS_setresgid, id, id, id) != 0 || ::syscall(SYS_setresuid, id, id, id) != 0) return false;
  __user_cap_header_struct header = {_LINUX_CAPABILITY_VERSION_3, 0};
  __user_cap_data_struct data[2] = {};
  data[0].permitted = data[0].effective = data[0].inheritable = static_cast<uint32_t>(set);
  if (::syscall(SYS_capset, &header, data) != 0) return false;
  for (int i = 0; i < 32; ++i)
    if ((set & capabilitySet(i)) != 0 && ::prctl(PR_CAP_AMBIENT, PR_CAP_AMBIENT_RAISE, i, 0, 0) != 0)
      return false;
  return true;
}

// "Inh Prm Eff Bnd Amb" of a thread ("/proc/thread-self", "/proc/1/task/1"), hexadecimal without leading zeros.
inline std::string capabilitiesOf(const std::string& thread) {
  std::string text;
  std::ifstream status(thread + "/status");
  for (std::string line; std::getline(status, line);) {
    if (!line.starts_with("Cap")) continue;
    const std::string number = line.substr(line.find_first_not_of(" \t", line.find(':') + 1));
    const size_t first = number.find_first_not_of('0');
    text += (text.empty() ? "" : " ") + (first == std::string::npos ? "0" : number.substr(first));
  }
  return text;
}

}  // namespace kyt
