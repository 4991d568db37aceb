#include "platform/linux/helpers/ProgramInspector.h"

#include <linux/capability.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>

#include "platform/base/Blocking.h"
#include "platform/linux/confinement/Capabilities.h"

namespace kyt {

struct ProgramAnswer {
  int32_t error = 0;
  int32_t pid = 0;  // of the question
  ProgramIdentity program;
  char path[256] = "";
};

namespace {

using Answer = ProgramAnswer;

// Nothing here allocates or takes a lock: it runs in a forked process.
Answer inspect(int32_t pid) {
  char path[32];
  std::snprintf(path, sizeof path, "/proc/%d/exe", pid);
  Answer answer;
  answer.pid = pid;
  struct stat status = {};
  if (pid <= 0) {
    answer.error = ESRCH;
  } else if (::stat(path, &status) != 0) {
    answer.error = errno;
    // Without its folder it is not there for us: it has ended, or it is hidden (a mount of /proc with hidepid).
    std::snprintf(path, sizeof path, "/proc/%d", pid);
    if (answer.error == ENOENT && ::stat(path, &status) != 0) answer.error = ESRCH;
  } else {
    answer.program = {status.st_dev, status.st_ino};
    (void)!::readlink(path, answer.path, sizeof answer.path - 1);
  }
  return answer;
}

// What looks at processes of other users. Where even root lacks that, a process must hold all that the one it looks
// at does, so root then keeps what it has.
CapabilitySet neededCapabilities() {
  const CapabilitySet held = effectiveCapabilities();
  constexpr CapabilitySet looking = capabilitySet(CAP_SYS_PTRACE);
  return (held & looking) == 0 && ::geteuid() == 0 ? held : looking;
}

void serve(int socket) {
  // It may be allowed to look at every process; so it can open nothing, which a look does not need.
  const rlimit none = {0, 0};
  if (::setrlimit(RLIMIT_NOFILE, &none) != 0 || keepCapabilities(neededCapabilities()) != 0) ::_exit(1);
  while (true) {
    int32_t pid = 0;
    const ssize_t count = ::recv(socket, &pid, sizeof pid, 0);
    if (count < 0 && errno == EINTR) continue;
    if (count <= 0) ::_exit(0);
    const Answer answer = inspect(count == sizeof pid ? pid : 0);
    (void)::send(socket, &answer, sizeof answer, MSG_NOSIGNAL);
  }
}

// In the daemon. One answer, or why there is none.
Answer receiveAnswer(int socket, int flags) {
  Answer answer, failed;
  ssize_t count = 0;
  do {
    count = ::recv(socket, &answer, sizeof answer, flags);
  } while (count < 0 && errno == EINTR);
  if (count == sizeof answer) return answer;
  failed.error = count < 0 && errno == EAGAIN ? ETIMEDOUT : EIO;
  return failed;
}

std::variant<ProgramIdentity, int> resultOf(const Answer& answer) {
  if (answer.error != 0) return answer.error;
  return answer.program;
}

}  // namespace

std::variant<ProgramIdentity, int> DirectProgramInspector::runningProgram(int32_t pid) {
  return resultOf(inspect(pid));
}

std::string DirectProgramInspector::programPath(int32_t pid) {
  return inspect(pid).path;
}

std::variant<std::unique_ptr<ProgramInspectorProcess>, std::string> ProgramInspectorProcess::start() {
  auto process = HelperProcess::start("kyt-inspector", serve);
  if (auto* const problem = std::get_if<std::string>(&process)) return std::move(*problem);
  return std::unique_ptr<ProgramInspectorProcess>(
      new ProgramInspectorProcess(std::get<std::unique_ptr<HelperProcess>>(std::move(process))));
}

Answer ProgramInspectorProcess::ask(int32_t pid) {
  const GateLock lock(asking_);
  const BlockingScope blocking;
  Answer failed;
  failed.error = ETIMEDOUT;
  // Each question has one answer, in order. While those of earlier ones are missing the helper stands still; who waited
  // for it would only make the next wait too.
  for (; unanswered_ != 0; --unanswered_)
    if (receiveAnswer(process_->socket(), MSG_DONTWAIT).error == ETIMEDOUT) return failed;
  failed.error = EIO;
  if (::send(process_->socket(), &pid, sizeof pid, MSG_NOSIGNAL) != sizeof pid) return failed;
  const Answer answer = receiveAnswer(process_->socket(), 0);
  if (answer.error == ETIMEDOUT) ++unanswered_;
  return answer.pid == pid || answer.error != 0 ? answer : failed;  // never another's
}

std::variant<ProgramIdentity, int> ProgramInspectorProcess::runningProgram(int32_t pid) {
  return resultOf(ask(pid));
}

std::string ProgramInspectorProcess::programPath(int32_t pid) {
  return ask(pid).path;
}

}  // namespace kyt
