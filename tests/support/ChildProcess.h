// Runs a part of a test in a process of its own, for what cannot be undone (confinement, mounts, signals).
#pragma once

#include <fcntl.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <functional>
#include <string>

namespace kyt {

// What `work` answered there (a text, usually what went wrong), or how the process ended instead. `meanwhile` runs in
// this process once the other has begun.
inline std::string inChildProcess(const std::function<std::string()>& work,
                                  const std::function<void()>& meanwhile = {}) {
  int ends[2];
  if (::pipe(ends) != 0) return "pipe failed";
  const pid_t child = ::fork();
  if (child < 0) return "fork failed";
  if (child == 0) {
    ::close(ends[0]);
    const int out = ::fcntl(ends[1], F_DUPFD_CLOEXEC, 200);  // out of the way of numbers that `work` may want
    ::close(ends[1]);
    const std::string text = work();
    const bool written = ::write(out, text.data(), text.size()) == static_cast<ssize_t>(text.size());
    ::_exit(written ? 0 : 99);
  }
  ::close(ends[1]);
  if (meanwhile) meanwhile();
  std::string text;
  char buffer[4096];
  for (ssize_t count = 0; (count = ::read(ends[0], buffer, sizeof buffer)) != 0;) {
    if (count < 0 && errno != EINTR) break;
    if (count > 0) text.append(buffer, static_cast<size_t>(count));
  }
  ::close(ends[0]);
  int status = 0;
  while (::waitpid(child, &status, 0) < 0 && errno == EINTR) {
  }
  if (!WIFEXITED(status) || WEXITSTATUS(status) != 0)
    text += " [the process ended with " + std::to_string(status) + "]";
  return text;
}

// From here on the mounts that this process makes are its own, and vanish with it. Whether it could be done.
[[nodiscard]] inline bool unshareMounts() {
  return ::unshare(CLONE_NEWNS) == 0 && ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0;
}

// Whether a child may make mounts of its own: for root, unless this runs in a folder that is no mount (a plain chroot).
inline bool mayMountOfItsOwn() {
  return inChildProcess([]() -> std::string { return unshareMounts() ? "" : "no"; }).empty();
}

}  // namespace kyt
