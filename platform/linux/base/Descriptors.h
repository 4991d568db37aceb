// Owning descriptors and making small ones. A Descriptor made here closes with close(2).
#pragma once

#include "platform/base/Descriptor.h"

namespace kyt {

void closeDescriptor(int descriptor);  // keeps errno

[[nodiscard]] inline Descriptor ownDescriptor(int descriptor) {
  return {descriptor, closeDescriptor};
}

// Non-blocking, closed on exec; negative (with errno) when the system refuses.
[[nodiscard]] Descriptor makeEventDescriptor();
void signalEventDescriptor(int descriptor);
void clearEventDescriptor(int descriptor);

}  // namespace kyt
