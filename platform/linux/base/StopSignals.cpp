#include "platform/linux/base/StopSignals.h"

#include <poll.h>
#include <pthread.h>
#include <sys/signalfd.h>
#include <sys/time.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <string_view>
#include <utility>

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

int StopSignals::next() const {
  signalfd_siginfo info = {};
  return ::read(signals_.get(), &info, sizeof info) == sizeof info ? static_cast<int>(info.ssi_signo) : 0;
}

bool StopSignals::isEndAsked() {
  while (ended_ == 0) {
    const int signal = next();
    if (signal == 0) break;
    if (signal == SIGHUP)
      isHangUpSeen_ = true;
    else
      ended_ = signal;
  }
  pollfd requested = {requests_.get(), POLLIN, 0};
  return ended_ != 0 || ::poll(&requested, 1, 0) == 1;
}

int StopSignals::wait() {
  if (const int ended = std::exchange(ended_, 0)) return ended;
  if (std::exchange(isHangUpSeen_, false)) return SIGHUP;
  for (;;) {
    pollfd descriptors[] = {{signals_.get(), POLLIN, 0}, {requests_.get(), POLLIN, 0}};
    if (::poll(descriptors, 2, -1) <= 0) continue;
    if (const int signal = next()) return signal;
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
