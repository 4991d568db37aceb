#include "platform/linux/system/ServiceManager.h"

#include <fcntl.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <utility>

#include "platform/SerialQueue.h"
#include "platform/TextEscape.h"
#include "platform/linux/system/LogSinks.h"
#include "platform/linux/system/SystemdLibrary.h"

namespace kyt {
namespace {

constexpr int kUtilityNice = 5;
constexpr int kBestEffortClass = 2;  // IOPRIO_CLASS_BE
constexpr int kUtilityPriority = 6;  // of 0 (first) to 7
constexpr int kOfThread = 1;         // IOPRIO_WHO_PROCESS; 0 is the calling thread

void tell(const std::string& state) {
  if (std::getenv("NOTIFY_SOCKET") == nullptr) return;
  const auto loaded = SystemdLibrary::load();
  if (const auto* problem = std::get_if<std::string>(&loaded)) {
    StderrSink().write(LogLevel::error, "ServiceManager(tell): cannot tell the service manager: " + *problem);
    return;
  }
  (void)std::get<SystemdLibrary>(loaded).notify(0, state.c_str());
}

}  // namespace

std::variant<FileHandle, std::string> ServiceManager::takeListeningSocket() {
  if (std::getenv("LISTEN_FDS") == nullptr) return FileHandle();
  const auto loaded = SystemdLibrary::load();
  if (const auto* problem = std::get_if<std::string>(&loaded)) return "LISTEN_FDS: " + *problem;
  const auto& systemd = std::get<SystemdLibrary>(loaded);
  const int count = systemd.listenDescriptors(1);
  if (count < 0) return "LISTEN_FDS: " + errorText(-count);
  if (count == 0) return FileHandle();
  FileHandle socket(SD_LISTEN_FDS_START);
  for (int extra = 1; extra < count; ++extra) ::close(SD_LISTEN_FDS_START + extra);
  if (count > 1) return std::string("LISTEN_FDS: more than one socket was handed over");
  if (systemd.isSocket(socket.get(), AF_UNIX, SOCK_STREAM, 1) <= 0) {
    return std::string("LISTEN_FDS: what was handed over is no listening Unix stream socket");
  }
  const int flags = ::fcntl(socket.get(), F_GETFL);
  if (flags < 0 || ::fcntl(socket.get(), F_SETFL, flags | O_NONBLOCK) != 0)
    return "LISTEN_FDS: " + errorText(errno);
  return socket;
}

void ServiceManager::ready(const std::string& status) {
  tell("READY=1\nSTATUS=" + escapedText(status));
}

void ServiceManager::stopping() {
  tell("STOPPING=1\nSTATUS=Stopping");
}

void ServiceManager::status(const std::string& status) {
  tell("STATUS=" + escapedText(status));
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
