#include "platform/linux/base/DescriptorRoom.h"

#include <fcntl.h>
#include <sys/resource.h>

#include <algorithm>

#include "platform/base/Blocking.h"
#include "platform/linux/base/Descriptors.h"

namespace kyt {
namespace {

// The most that a process may have, unless an administrator changed the system's limit.
constexpr int kMost = 1 << 20;

// A descriptor with a high number makes the table as large as that; it goes at once, the table stays.
void makeRoom(int count) {
  rlimit limit = {};
  if (::getrlimit(RLIMIT_NOFILE, &limit) != 0) return;
  const int most = static_cast<int>(std::min<rlim_t>(limit.rlim_cur, static_cast<rlim_t>(count)));
  const Descriptor any = makeEventDescriptor();
  if (any.get() < 0 || most <= any.get() + 1) return;
  const Descriptor high = ownDescriptor(::fcntl(any.get(), F_DUPFD_CLOEXEC, most - 1));
}

}  // namespace

DescriptorRoom::DescriptorRoom() : half_(kAtFirst / 2) {
  makeRoom(kAtFirst);
}

void DescriptorRoom::grow(int descriptor) {
  if (growing_.exchange(true)) return;
  int half = half_;
  if (descriptor >= half && half < kMost) {
    while (half <= descriptor && half < kMost) half *= 2;
    const BlockingScope blocking;
    makeRoom(2 * half);
    half_ = half;
  }
  growing_ = false;
}

}  // namespace kyt
