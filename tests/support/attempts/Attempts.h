/* What an intruder who runs code within the confined daemon would try, one function each. Plain C without
 * anything of this project's, so that it serves both as a part of a test's process and as a plug-in in the real
 * daemon. */
#pragma once

#include <stddef.h>

#ifdef __cplusplus
extern "C" {
#endif

enum { kAttemptEndsTheProcess = -1 };

struct Attempt {
  const char* name;
  /* 0 when it was let, otherwise errno. `root`: the folder that stands for the file system's root; it holds
   * `outside/file`, a program at `outside/program`, and the daemon's folders. */
  int (*run)(const char* root);
  int expected; /* errno, or kAttemptEndsTheProcess */
};
extern const struct Attempt kAttempts[];
extern const size_t kAttemptCount;

#ifdef __cplusplus
}
#endif
