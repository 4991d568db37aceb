/* What an intruder who runs code within the confined daemon would try, one function each. Plain C without
 * anything of this project's, so that it serves both as a part of a test's process and as a plug-in in the real
 * daemon. None does harm where it is let: the tests try most of them outside of the confinement too, as root. */
#pragma once

#include <stddef.h>

#ifdef __cplusplus
extern "C" {
#endif

enum { kAttemptEndsTheProcess = -1 };

struct Attempt {
  const char* name;
  /* 0 when it was let, otherwise errno. `root`: the folder that stands for the file system's root; it holds
   * `outside/file` and the daemon's folders. */
  int (*run)(const char* root);
  int expected; /* errno, or kAttemptEndsTheProcess */
  int landlock; /* the version of the kernel's Landlock that refuses it; 0: every kernel does */
};
extern const struct Attempt kAttempts[];
extern const size_t kAttemptCount;

/* What connectToAnAbstractSocket reaches for, open outside of the confinement: a descriptor, -1 when that fails. */
int openAbstractSocketForAttempts(const char* root);

#ifdef __cplusplus
}
#endif
