// One step of a short busy wait. Used where another thread is expected to be done within a microsecond or so.
#pragma once

namespace kyt {

inline void spinPause() {
#if defined(__x86_64__) || defined(__i386__)
  __builtin_ia32_pause();
#elif defined(__aarch64__)
  asm volatile("yield");
#endif
}

}  // namespace kyt
