#include "platform/linux/url/URLNetwork.h"

#include <sys/epoll.h>

#include <cerrno>
#include <system_error>
#include <utility>

#include "platform/linux/base/Descriptors.h"
#include "platform/linux/base/Threads.h"

namespace kyt {
namespace {

constexpr uint64_t kWake = ~uint64_t{0};
static_assert(kWake != RouteWatch::kEpollKey);
constexpr Duration kRefusedPause = std::chrono::milliseconds(10);
constexpr Duration kRest = std::chrono::milliseconds(200);
constexpr Duration kStopPatience = std::chrono::seconds(5);

MonotonicTime currentTime() {
  return std::chrono::steady_clock::now();
}

}  // namespace

URLNetwork::URLNetwork(CurlURLSessionOptions options, Log& log, Counters& counters)
    : tools_(std::move(options), log, counters),
      requests_(tools_, completions_),
      rest_(Deadline::calling<&URLNetwork::wakeSockets>(tools_.deadlines, *this)) {}

void URLNetwork::start(std::shared_ptr<URLTransfer> transfer) {
  tools_.figures.add(&URLFigures::started);
  outstanding_.fetch_add(1);
  submit({Kind::start, std::move(transfer), nullptr});
}

void URLNetwork::cancel(std::shared_ptr<URLTransfer> transfer) {
  submit({Kind::cancel, std::move(transfer), nullptr});
}

void URLNetwork::invalidate(std::shared_ptr<URLSessionState> session) {
  submit({Kind::invalidate, nullptr, std::move(session)});
}

void URLNetwork::cancelAwaited() {
  requests_.wantNoneAwaited();
  wakeUp();
}

void URLNetwork::cancelAll() {
  requests_.wantNone();
  wakeUp();
}

// Taken up with the next command: what is on its way keeps what it began with.
void URLNetwork::reconfigure(CurlURLSessionFactory::Access access) {
  MutexLock lock(mutex_);
  access_ = std::move(access);
}

void URLNetwork::wakeUp() {
  MutexLock lock(mutex_);
  if (running_) signalEventDescriptor(wake_.get());
}

void URLNetwork::submit(Command command) {
  {
    MutexLock lock(mutex_);
    if (stopping_) return;
    commands_.push_back(std::move(command));
    if (running_) {
      if (commands_.size() == 1) signalEventDescriptor(wake_.get());
      return;
    }
    if (startThread()) return;
  }
  insistOnTheThread();
}

// Without the thread nothing would end the request, not even its time-out, and whoever waits for it may hold what all
// others need. Better that the caller waits until the system gives what it has refused.
void URLNetwork::insistOnTheThread() {
  tools_.log.error("CurlURLSession(start): cannot start the network thread, the request is delayed");
  for (;;) {
    std::this_thread::sleep_for(kRefusedPause);
    MutexLock lock(mutex_);
    if (stopping_ || running_ || startThread()) return;
  }
}

bool URLNetwork::startThread() {
  if (epoll_.get() < 0) epoll_ = ownDescriptor(epoll_create1(EPOLL_CLOEXEC));
  if (wake_.get() < 0) wake_ = makeEventDescriptor();
  if (epoll_.get() < 0 || wake_.get() < 0) return false;
  epoll_event wake{};
  wake.events = EPOLLIN | EPOLLET;  // an edge for each write: it need not be read
  wake.data.u64 = kWake;
  // Without it the thread would not hear of further requests.
  if (epoll_ctl(epoll_.get(), EPOLL_CTL_ADD, wake_.get(), &wake) != 0 && errno != EEXIST) return false;
  try {
    thread_ = std::thread([this] { run(); });
    running_ = true;
  } catch (const std::system_error&) {  // too many threads
  }
  return running_;
}

bool URLNetwork::stopWithin(Duration patience) {
  const auto end = std::chrono::steady_clock::now() + patience;
  std::thread thread;
  cancelAll();
  {
    MutexLock lock(mutex_);
    stopping_ = true;
    thread = std::move(thread_);
    if (running_) signalEventDescriptor(wake_.get());
  }
  if (!thread.joinable()) return true;
  {
    MutexLock lock(mutex_);
    while (!threadEnds_)
      if (!changed_.waitUntil(mutex_, end) && !threadEnds_) {
        thread_ = std::move(thread);  // it waits for a file whose file system never answers, say
        return false;
      }
  }
  thread.join();
  {
    MutexLock lock(mutex_);
    while (outstanding_.load() != 0 && changed_.waitUntil(mutex_, end)) {
    }
  }
  return completions_.shutDownWithin(end - std::chrono::steady_clock::now());
}

void URLNetwork::stop() {
  static_cast<void>(stopWithin(kStopPatience));
  std::thread thread;
  {
    MutexLock lock(mutex_);
    thread = std::move(thread_);
  }
  if (thread.joinable()) thread.join();
  completions_.shutDown();
}

void URLNetwork::completionHasRun() {
  if (outstanding_.fetch_sub(1) != 1) return;
  MutexLock lock(mutex_);
  changed_.notifyAll();
}

void URLNetwork::run() {
  beginServiceThread("kyt-network");
  completions_.begin(tools_.options);
  tools_.sockets.setEpoll(epoll_.get());
  requests_.routes().setEpoll(epoll_.get());
  tools_.now = currentTime();
  for (;;) {
    takeCommands();
    tools_.deadlines.fireUntil(tools_.now);
    const bool ends =
        requests_.isNoneWanted();  // before what is there is cancelled, or some of it might be left
    requests_.cancelUnwanted();
    requests_.activateNextInLine();
    requests_.emptyRetiredPools();
    if (ends) {
      MutexLock lock(mutex_);
      if (stopping_ && commands_.empty()) break;
    }
    epoll_event events[64];
    const MonotonicTime before = currentTime();
    const int count = epoll_wait(epoll_.get(), events, 64, waitingTime());
    tools_.now = currentTime();
    tools_.rested += tools_.now - before;
    tools_.sockets.beginTurn();
    if (tools_.sockets.areSomeRefused()) tools_.sockets.watchRefused();
    for (int i = 0; i < count; ++i) handleEvent(events[i].data.u64, events[i].events);
  }
  requests_.closeAllPools();
  tools_.tickets.forget();
  if (tools_.curl) tools_.curl->globalCleanup();
  MutexLock lock(mutex_);
  threadEnds_ = true;
  changed_.notifyAll();
}

// In milliseconds, -1: for ever. What the kernel refuses to watch it is soon asked for again.
int URLNetwork::waitingTime() const {
  const int time = tools_.deadlines.millisecondsFrom(tools_.now);
  constexpr int kSoon = 10;
  return tools_.sockets.areSomeRefused() && (time < 0 || time > kSoon) ? kSoon : time;
}

void URLNetwork::handleEvent(uint64_t which, uint32_t events) {
  if (which == kWake) return;  // commands are taken after every wait
  if (which == RouteWatch::kEpollKey) {
    requests_.routes().takeEvents();
    return;
  }
  const int socket = static_cast<int>(which);
  if (URLConnectionPool* pool = tools_.sockets.poolOf(socket)) {
    pool->socketReady(socket, events);
    if (tools_.sockets.restsAfter(socket, events) && !rest_.isSet()) rest_.set(tools_.now + kRest);
  }
}

void URLNetwork::takeCommands() {
  {
    MutexLock lock(mutex_);
    if (access_) {
      tools_.certificates.setFile(std::move(access_->certificateFile));
      tools_.routes.setCellularInterfaces(std::move(access_->cellularInterfaces));
      access_.reset();
    }
    if (commands_.empty()) return;
    taken_.swap(commands_);
  }
  for (Command& command : taken_) {
    switch (command.kind) {
      case Kind::start:
        requests_.begin(std::move(command.transfer));
        break;
      case Kind::cancel:
        requests_.cancel(*command.transfer);
        break;
      case Kind::invalidate:
        for (const auto& pool : command.session->pools)
          if (pool) pool->closeIfIdle();
        break;
    }
  }
  taken_.clear();
}

}  // namespace kyt
