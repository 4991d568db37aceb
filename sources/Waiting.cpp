#include "sources/Waiting.h"

#include <poll.h>
#include <signal.h>
#include <sys/signalfd.h>

#include <algorithm>
#include <cerrno>

#include "platform/linux/base/Descriptors.h"

namespace kyt::sources {

Waiting::Waiting() {
  sigset_t signals;
  sigemptyset(&signals);
  sigaddset(&signals, SIGTERM);
  sigaddset(&signals, SIGINT);
  ::pthread_sigmask(SIG_BLOCK, &signals, nullptr);
  ::signal(SIGPIPE, SIG_IGN);
  signals_ = ownDescriptor(::signalfd(-1, &signals, SFD_NONBLOCK | SFD_CLOEXEC));
}

Waiting::Woken Waiting::wait(int descriptor, std::optional<Time> until) {
  pollfd waited[] = {{signals_.get(), POLLIN, 0}, {descriptor, POLLIN, 0}};
  while (true) {
    int timeout = -1;
    if (until) {
      const auto left =
          std::chrono::ceil<std::chrono::milliseconds>(*until - std::chrono::steady_clock::now());
      timeout = static_cast<int>(std::clamp<int64_t>(left.count(), 0, 3'600'000));
    }
    const int count = ::poll(waited, 2, timeout);
    if (count < 0 && errno == EINTR) continue;
    if (waited[0].revents != 0) return Woken::stop;
    if (count > 0) return Woken::news;
    if (until && std::chrono::steady_clock::now() >= *until) return Woken::time;
  }
}

}  // namespace kyt::sources
