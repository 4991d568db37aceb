#include "platform/linux/base/StopSignals.h"

#include <poll.h>
#include <pthread.h>
#include <sys/signalfd.h>
#include <sys/time.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <string_view>

#include "platform/linux/base/Descriptors.h"

namespace kyt {
namespace {

volatile std::sig_atomic_t lastStatus = 0;

void endNow(int /*signal*/) {
  constexpr std::string_view kLine = "<3>shutDown: Not ended in time, ending without what still waits\n";
  pollfd standardError = {STDERR_FILENO, POLLOUT, 0};
  if (::poll(&standardError, 1, 0) == 1) (void)!::write(STDERR_FILENO, kLine.data(), kLine.size());
  ::_exit(lastStatus);
}

void ignoreOthers() {
  for (const int ignored : {SIGPIPE, SIGUSR1, SIGUSR2, SIGALRM, SIGVTALRM, SIGPROF, SIGIO, SIGPWR, SIGSTKFLT})
    std::signal(ignored, SIG_IGN);
  for (int ignored = SIGRTMIN; ignored <= SIGRTMAX; ++ignored) std::signal(ignored, SIG_IGN);
}

}  // namespace

StopSignals::StopSignals() : requests_(makeEventDescriptor()) {
  if (requests_.get() < 0) error_ = errno;
  sigset_t signals;
  sigemptyset(&signals);
  for (const int told : {SIGTERM, SIGINT, SIGHUP}) sigaddset(&signals, told);
  pthread_sigmask(SIG_BLOCK, &signals, nullptr);
  signals_ = ownDescriptor(::signalfd(-1, &signals, SFD_CLOEXEC | SFD_NONBLOCK));
  if (signals_.get() < 0) error_ = errno;
  ignoreOthers();
}

int StopSignals::wait() {
  for (;;) {
    pollfd descriptors[] = {{signals_.get(), POLLIN, 0}, {requests_.get(), POLLIN, 0}};
    if (::poll(descriptors, 2, -1) <= 0) continue;
    signalfd_siginfo info = {};
    if (::read(signals_.get(), &info, sizeof info) == sizeof info) return static_cast<int>(info.ssi_signo);
    if ((descriptors[1].revents & POLLIN) != 0) {
      clearEventDescriptor(requests_.get());
      return 0;
    }
  }
}

void StopSignals::request() {
  signalEventDescriptor(requests_.get());
}

void endProcessAtTheLatest(std::chrono::seconds after, int status) {
  lastStatus = status;
  std::signal(SIGALRM, endNow);
  const itimerval setting = {{0, 0}, {static_cast<time_t>(after.count()), 0}};
  ::setitimer(ITIMER_REAL, &setting, nullptr);
}

}  // namespace kyt
