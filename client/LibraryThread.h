// The library's thread as the analysis of locks knows it: what belongs to it is GUARDED_BY(libraryThread), what runs on it
// REQUIRES(libraryThread). So a use from one of the program's threads is refused.
#pragma once

#include "platform/base/Mutex.h"

namespace kyt::client {

class CAPABILITY("library's thread") LibraryThread {
 public:
  // Said where the library's thread begins its work, and where nothing runs for a session on it: before it has got one,
  // after its end, and in a forked child.
  void assertCurrent() const ASSERT_CAPABILITY(this) {}
};
inline constexpr LibraryThread libraryThread;

}  // namespace kyt::client
