// How many instructions some work takes, counted one by one: the same on every machine, whatever runs beside.
#pragma once

#include <signal.h>
#include <sys/ptrace.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdint>
#include <optional>

namespace kyt::bench {

// The instructions of one call of `work` in a process of its own, in which it has run once before. None where processes
// may not be traced.
template <typename Work>
std::optional<uint64_t> instructionsOf(Work&& work) {
  const pid_t child = fork();
  if (child == 0) {
    if (ptrace(PTRACE_TRACEME, 0, nullptr, nullptr) != 0) _exit(77);
    work();
    raise(SIGSTOP);
    work();
    raise(SIGSTOP);
    _exit(0);
  }
  int status = 0;
  uint64_t count = 0;
  bool steps = false;
  while (waitpid(child, &status, 0) == child && WIFSTOPPED(status)) {
    const int signal = WSTOPSIG(status);
    if (signal == SIGSTOP) {
      if (steps) break;
      steps = true;
    } else if (signal != SIGTRAP) {
      break;
    }
    ++count;
    if (ptrace(PTRACE_SINGLESTEP, child, nullptr, nullptr) != 0) break;
  }
  const bool counted = steps && WIFSTOPPED(status) && WSTOPSIG(status) == SIGSTOP;
  if (WIFSTOPPED(status)) {
    kill(child, SIGKILL);
    waitpid(child, &status, 0);
  }
  return counted ? std::optional(count) : std::nullopt;
}

}  // namespace kyt::bench
