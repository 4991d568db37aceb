#include "platform/linux/helpers/HelperProcess.h"

#include <signal.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/time.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <cerrno>

namespace kyt {
namespace {

void leaveTheDaemon(const char* name, int socket) {
  // A terminal's Ctrl-C reaches this process too; it ends with the daemon and not before.
  for (const int ignored : {SIGINT, SIGTERM, SIGHUP, SIGPIPE}) ::signal(ignored, SIG_IGN);
  ::signal(SIGALRM, SIG_DFL);  // ends what a child of it does for too long
  ::prctl(PR_SET_NAME, name);
  ::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0);
  ::prctl(PR_SET_DUMPABLE, 0, 0, 0, 0);
  if (socket > 0) ::syscall(SYS_close_range, 0U, static_cast<unsigned>(socket) - 1, 0U);
  ::syscall(SYS_close_range, static_cast<unsigned>(socket) + 1, ~0U, 0U);
}

}  // namespace

std::variant<std::unique_ptr<HelperProcess>, std::string> HelperProcess::start(
    const char* name, const std::function<void(int)>& serve) {
  int ends[2];
  if (::socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends) != 0)
    return "socketpair: " + errorText(errno);
  Descriptor mine = ownDescriptor(ends[0]), theirs = ownDescriptor(ends[1]);
  const pid_t child = ::fork();
  if (child < 0) return "fork: " + errorText(errno);
  if (child == 0) {
    leaveTheDaemon(name, theirs.get());
    serve(theirs.get());
    ::_exit(0);
  }
  const timeval patience = {2, 0};
  ::setsockopt(mine.get(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
  ::setsockopt(mine.get(), SOL_SOCKET, SO_SNDTIMEO, &patience, sizeof patience);
  return std::unique_ptr<HelperProcess>(new HelperProcess(std::move(mine), child));
}

HelperProcess::~HelperProcess() {
  { const Descriptor closed = std::move(socket_); }
  // Somebody may have stopped it, and the confined daemon cannot end it.
  constexpr int kLooks = 400;  // four seconds
  constexpr timespec kPause = {0, 10'000'000};
  for (int look = 0; look < kLooks; ++look) {
    const pid_t ended = ::waitpid(child_, nullptr, WNOHANG);
    if (ended == child_ || (ended < 0 && errno != EINTR)) return;
    ::nanosleep(&kPause, nullptr);
  }
}

}  // namespace kyt
