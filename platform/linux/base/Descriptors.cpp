#include "platform/linux/base/Descriptors.h"

#include <errno.h>
#include <sys/eventfd.h>
#include <unistd.h>

namespace kyt {

void closeDescriptor(int descriptor) {
  const int kept = errno;
  close(descriptor);
  errno = kept;
}

Descriptor makeEventDescriptor() {
  return ownDescriptor(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
}

void signalEventDescriptor(int descriptor) {
  (void)eventfd_write(descriptor, 1);
}

void clearEventDescriptor(int descriptor) {
  eventfd_t value;
  (void)eventfd_read(descriptor, &value);
}

}  // namespace kyt
