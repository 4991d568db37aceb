#include "platform/linux/service/ServiceManager.h"

#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/time.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstddef>
#include <cstdlib>
#include <string_view>
#include <utility>

#include "platform/base/TextEscape.h"
#include "platform/linux/files/Files.h"
#include "platform/linux/service/LogSinks.h"
#include "platform/queues/SerialQueue.h"

namespace kyt {
namespace {

constexpr int kUtilityNice = 5;
constexpr int kBestEffortClass = 2;  // IOPRIO_CLASS_BE
constexpr int kUtilityPriority = 6;  // of 0 (first) to 7
constexpr int kOfThread = 1;         // IOPRIO_WHO_PROCESS; 0 is the calling thread

constexpr timeval kPatience = {2, 0};  // with a service manager that does not listen

// Where the service manager listens: a path, or "@" and an abstract name.
bool fillNotifyAddress(std::string_view place, sockaddr_un& address, socklen_t& size) {
  address = {};
  address.sun_family = AF_UNIX;
  if (place.size() < 2 || place.size() >= sizeof address.sun_path) return false;
  if (!place.starts_with('/') && !place.starts_with('@')) return false;
  place.copy(address.sun_path, place.size());
  if (place.starts_with('@')) address.sun_path[0] = '\0';
  size = static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + place.size() + (place[0] == '/' ? 1 : 0));
  return true;
}

// Not with libsystemd: its function waits without end when nobody reads, and then nothing here would end in order.
int tell(const std::string& state) {
  const char* const place = std::getenv("NOTIFY_SOCKET");
  if (place == nullptr) return 0;
  sockaddr_un address;
  socklen_t size = 0;
  if (!fillNotifyAddress(place, address, size)) return EINVAL;
  const Descriptor socket = ownDescriptor(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  if (!socket || ::setsockopt(socket.get(), SOL_SOCKET, SO_SNDTIMEO, &kPatience, sizeof kPatience) != 0)
    return errno;
  const auto* const to = reinterpret_cast<const sockaddr*>(&address);
  return ::sendto(socket.get(), state.data(), state.size(), MSG_NOSIGNAL, to, size) < 0 ? errno : 0;
}

void tellOrSay(const std::string& state) {
  if (const int error = tell(state))
    StderrSink().write(LogLevel::error,
                       "ServiceManager(tell): cannot tell the service manager: " + errorText(error));
}

}  // namespace

void ServiceManager::ready(const std::string& status) {
  tellOrSay("READY=1\nSTATUS=" + escapedText(status));
}

void ServiceManager::stopping() {
  tellOrSay("STOPPING=1\nSTATUS=Stopping");
}

void ServiceManager::status(const std::string& status) {
  tellOrSay("STATUS=" + escapedText(status));
}

void ServiceManager::alive() {
  (void)tell("WATCHDOG=1");  // what is missed is missed: the next one follows
}

bool enterUtilityServiceClass() {
  bool all = true;
  errno = 0;
  const int nice = ::getpriority(PRIO_PROCESS, 0);
  if (errno != 0 || (nice < kUtilityNice && ::setpriority(PRIO_PROCESS, 0, kUtilityNice) != 0)) all = false;
  // A service manager may have seen to it, and then not allow the call.
  constexpr long wanted = kBestEffortClass << 13 | kUtilityPriority;
  if (::syscall(SYS_ioprio_get, kOfThread, 0) != wanted &&
      ::syscall(SYS_ioprio_set, kOfThread, 0, wanted) != 0)
    all = false;
  return all;
}

struct LinuxProcessTransaction::State {
  State(Options o, TimerService& t, std::shared_ptr<SerialQueue> q, std::function<bool()> f)
      : options(o), timers(t), queue(std::move(q)), idleElapsed(std::move(f)) {}
  const Options options;
  TimerService& timers;
  const std::shared_ptr<SerialQueue> queue;
  const std::function<bool()> idleElapsed;
  mutable Mutex mutex;
  bool open GUARDED_BY(mutex) = false;
  bool ended GUARDED_BY(mutex) = false;  // the owner is gone, or the process ends
  uint64_t wait GUARDED_BY(mutex) = 0;   // which wait is the current one
  TimerHandle timer GUARDED_BY(mutex);
};

LinuxProcessTransaction::LinuxProcessTransaction(Options options, TimerService& timers,
                                                 std::shared_ptr<SerialQueue> queue,
                                                 std::function<bool()> idleElapsed)
    : state_(std::make_shared<State>(options, timers, std::move(queue), std::move(idleElapsed))) {
  wait(state_);
}

LinuxProcessTransaction::~LinuxProcessTransaction() {
  TimerHandle timer;
  MutexLock lock(state_->mutex);
  state_->ended = true;
  timer = std::move(state_->timer);
}

void LinuxProcessTransaction::wait(const std::shared_ptr<State>& state) {
  if (!state->options.socketActivated) return;
  uint64_t number = 0;
  {
    MutexLock lock(state->mutex);
    if (state->open || state->ended) return;
    number = ++state->wait;
  }
  const Duration delay =
      std::chrono::duration_cast<Duration>(std::chrono::duration<double>(state->options.idleExitSeconds));
  TimerHandle timer = state->timers.after(delay, state->queue, [weak = std::weak_ptr<State>(state), number] {
    const auto strong = weak.lock();
    if (strong == nullptr) return;
    {
      MutexLock lock(strong->mutex);
      if (strong->open || strong->ended || strong->wait != number) return;
    }
    if (!strong->idleElapsed()) wait(strong);
  });
  MutexLock lock(state->mutex);
  if (state->wait == number && !state->open && !state->ended) std::swap(state->timer, timer);
}

void LinuxProcessTransaction::begin() {
  TimerHandle timer;
  MutexLock lock(state_->mutex);
  state_->open = true;
  ++state_->wait;
  timer = std::move(state_->timer);
}

void LinuxProcessTransaction::end() {
  {
    MutexLock lock(state_->mutex);
    state_->open = false;
  }
  wait(state_);
}

bool LinuxProcessTransaction::isOpen() const {
  MutexLock lock(state_->mutex);
  return state_->open;
}

}  // namespace kyt
