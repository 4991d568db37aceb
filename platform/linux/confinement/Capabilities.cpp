#include "platform/linux/confinement/Capabilities.h"

#include <linux/capability.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>

namespace kyt {
namespace {

constexpr int kMostCapabilities = 64;

struct Capabilities {
  __user_cap_header_struct header = {_LINUX_CAPABILITY_VERSION_3, 0};
  __user_cap_data_struct data[2] = {};
  bool read() { return ::syscall(SYS_capget, &header, data) == 0; }
  bool write() { return ::syscall(SYS_capset, &header, data) == 0; }
  [[nodiscard]] CapabilitySet effective() const {
    return CapabilitySet{data[1].effective} << 32 | data[0].effective;
  }
};

// A kernel answers EINVAL for capabilities that it does not know.
int emptyBoundingSet() {
  for (int capability = 0; capability < kMostCapabilities; ++capability) {
    const int held = ::prctl(PR_CAPBSET_READ, capability, 0, 0, 0);
    if (held < 0 && errno != EINVAL) return errno;
    if (held != 1) continue;
    if (::prctl(PR_CAPBSET_DROP, capability, 0, 0, 0) != 0) return errno;
  }
  return 0;
}

}  // namespace

CapabilitySet effectiveCapabilities() {
  Capabilities capabilities;
  return capabilities.read() ? capabilities.effective() : 0;
}

int keepCapabilities(CapabilitySet kept) {
  Capabilities capabilities;
  if (!capabilities.read()) return errno;
  if ((capabilities.effective() & capabilitySet(CAP_SETPCAP)) != 0)
    if (const int error = emptyBoundingSet()) return error;
  if (::prctl(PR_CAP_AMBIENT, PR_CAP_AMBIENT_CLEAR_ALL, 0, 0, 0) != 0) return errno;
  for (int word = 0; word < 2; ++word) {
    __user_cap_data_struct& data = capabilities.data[word];
    data.permitted &= static_cast<uint32_t>(kept >> (32 * word));
    data.effective = data.permitted;
    data.inheritable = 0;
  }
  return capabilities.write() ? 0 : errno;
}

int giveUpCapabilities() {
  constexpr CapabilitySet filesOfOthers =
      capabilitySet(CAP_CHOWN) | capabilitySet(CAP_DAC_OVERRIDE) | capabilitySet(CAP_FOWNER);
  return keepCapabilities(::geteuid() == 0 ? filesOfOthers : 0);
}

}  // namespace kyt
