#include "platform/linux/base/StopSignals.h"

#include <poll.h>
#include <pthread.h>
#include <sys/signalfd.h>

#include <csignal>

#include <unistd.h>

#include "platform/linux/base/Descriptors.h"

namespace kyt {

StopSignals::StopSignals() : requests_(makeEventDescriptor()) {
  sigset_t signals;
  sigemptyset(&signals);
  sigaddset(&signals, SIGTERM);
  sigaddset(&signals, SIGINT);
  pthread_sigmask(SIG_BLOCK, &signals, nullptr);
  signals_ = ownDescriptor(::signalfd(-1, &signals, SFD_CLOEXEC | SFD_NONBLOCK));
  std::signal(SIGPIPE, SIG_IGN);
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

}  // namespace kyt
