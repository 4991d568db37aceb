#include "platform/linux/system/ProgramInspector.h"

#include <linux/capability.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/time.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>

#include "platform/linux/system/Capabilities.h"

namespace kyt {
namespace {

struct Answer {
  int32_t error = 0;
  int32_t pid = 0;  // of the question, so that an answer that came too late is not taken for another's
  ProgramIdentity program;
  char path[256] = "";
};

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

[[noreturn]] void serve(int socket) {
  // A terminal's Ctrl-C reaches this process too; it ends with the daemon and not before.
  ::signal(SIGINT, SIG_IGN);
  ::signal(SIGTERM, SIG_IGN);
  ::signal(SIGHUP, SIG_IGN);
  ::signal(SIGPIPE, SIG_IGN);
  ::prctl(PR_SET_NAME, "kyt-inspector");
  ::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0);
  ::prctl(PR_SET_DUMPABLE, 0, 0, 0, 0);
  if (socket > 0) ::syscall(SYS_close_range, 0U, static_cast<unsigned>(socket) - 1, 0U);
  ::syscall(SYS_close_range, static_cast<unsigned>(socket) + 1, ~0U, 0U);
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

// In the daemon.
Answer ask(int socket, int32_t pid) {
  Answer failed;
  failed.error = EIO;
  if (::send(socket, &pid, sizeof pid, MSG_NOSIGNAL) != sizeof pid) return failed;
  while (true) {
    Answer answer;
    const ssize_t count = ::recv(socket, &answer, sizeof answer, 0);
    if (count < 0 && errno == EINTR) continue;
    if (count < 0 && errno == EAGAIN) failed.error = ETIMEDOUT;
    if (count != sizeof answer) return failed;
    if (answer.pid == pid) return answer;
  }
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
  int ends[2];
  if (::socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends) != 0)
    return "socketpair: " + errorText(errno);
  FileHandle mine(ends[0]), theirs(ends[1]);
  const pid_t child = ::fork();
  if (child < 0) return "fork: " + errorText(errno);
  if (child == 0) serve(theirs.get());
  const timeval patience = {2, 0};
  ::setsockopt(mine.get(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
  ::setsockopt(mine.get(), SOL_SOCKET, SO_SNDTIMEO, &patience, sizeof patience);
  return std::unique_ptr<ProgramInspectorProcess>(new ProgramInspectorProcess(std::move(mine), child));
}

ProgramInspectorProcess::~ProgramInspectorProcess() {
  {
    MutexLock lock(mutex_);
    const FileHandle closed = std::move(socket_);
  }
  int status = 0;
  while (::waitpid(child_, &status, 0) < 0 && errno == EINTR) {
  }
}

std::variant<ProgramIdentity, int> ProgramInspectorProcess::runningProgram(int32_t pid) {
  MutexLock lock(mutex_);
  return resultOf(ask(socket_.get(), pid));
}

std::string ProgramInspectorProcess::programPath(int32_t pid) {
  MutexLock lock(mutex_);
  return ask(socket_.get(), pid).path;
}

}  // namespace kyt
