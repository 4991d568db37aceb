#include "platform/linux/url/URLNetwork.h"

#include <strings.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <system_error>

#include "platform/base/Limits.h"
#include "platform/linux/base/CodePages.h"
#include "platform/linux/base/Threads.h"

namespace kyt {
namespace {

constexpr uint64_t kWake = ~uint64_t{0};
constexpr uint64_t kRoutes = kWake - 1;  // as in URLNetworkWaiting.cpp
constexpr Duration kRefusedPause = std::chrono::milliseconds(10);
constexpr Duration kRest = std::chrono::milliseconds(200);
constexpr Duration kStopPatience = std::chrono::seconds(5);

MonotonicTime currentTime() {
  return std::chrono::steady_clock::now();
}

// libcurl takes an address without a scheme, or with a single slash behind it, for one over plain http: what
// forces https by looking at the scheme would not see it.
bool namesItsScheme(const std::string& url) {
  return strncasecmp(url.c_str(), "http://", 7) == 0 || strncasecmp(url.c_str(), "https://", 8) == 0;
}

WorkerPoolOptions completionWorkers(const CurlURLSessionOptions& session) {
  WorkerPoolOptions options;
  options.idleExit = session.quietTime;
  options.whenQuiet = session.whenQuiet;
  options.runnable = 2;
  options.maxWorkers = 4;
  options.name = "kyt-url";
  options.nameThread = beginServiceThread;
  return options;
}

}  // namespace

URLNetwork::URLNetwork(CurlURLSessionOptions options, Log& log, Counters& counters)
    : options_(std::move(options)),
      log_(log),
      counters_(counters),
      idlePools_(options_.maxIdlePools),
      routes_(options_.cellularInterfaces, options_.sysClassNet, options_.resolverFile),
      certificates_(options_.certificateFile),
      lines_(options_.maxActiveRequests, options_.maxActiveRequestsToOneServer),
      settle_(
          deadlines_,
          [](void* owner) {
            auto* network = static_cast<URLNetwork*>(owner);
            network->judgeConnections();
            network->retryWaiting(false);
          },
          this),
      slowRetry_(
          deadlines_, [](void* network) { static_cast<URLNetwork*>(network)->waitingTimer(); }, this),
      rest_(
          deadlines_, [](void* network) { static_cast<URLNetwork*>(network)->sockets_.wake(); }, this),
      quiet_(
          deadlines_,
          [](void* owner) {
            const auto* network = static_cast<URLNetwork*>(owner);
            if (network->sessions_.empty()) network->options_.whenQuiet();
          },
          this) {}

URLNetwork::~URLNetwork() {
  if (epoll_ >= 0) close(epoll_);
  if (wake_ >= 0) close(wake_);
}

void URLNetwork::start(std::shared_ptr<URLTransfer> transfer) {
  started_.fetch_add(1, std::memory_order_relaxed);
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
  awaitedCancelled_ = true;
  wakeUp();
}

void URLNetwork::cancelAll() {
  cancelled_ = true;
  wakeUp();
}

void URLNetwork::wakeUp() {
  MutexLock lock(mutex_);
  if (running_) eventfd_write(wake_, 1);
}

void URLNetwork::submit(Command command) {
  {
    MutexLock lock(mutex_);
    if (stopping_) return;
    commands_.push_back(std::move(command));
    if (running_) {
      if (commands_.size() == 1) eventfd_write(wake_, 1);
      return;
    }
    if (startThread()) return;
  }
  insistOnTheThread();
}

// Without the thread nothing would end the request, not even its time-out, and whoever waits for it may hold what all
// others need. Better that the caller waits until the system gives what it has refused.
void URLNetwork::insistOnTheThread() {
  log_.error("CurlURLSession(start): cannot start the network thread, the request is delayed");
  for (;;) {
    std::this_thread::sleep_for(kRefusedPause);
    MutexLock lock(mutex_);
    if (stopping_ || running_ || startThread()) return;
  }
}

bool URLNetwork::startThread() {
  if (epoll_ < 0) epoll_ = epoll_create1(EPOLL_CLOEXEC);
  if (wake_ < 0) wake_ = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
  if (epoll_ < 0 || wake_ < 0) return false;
  epoll_event wake{};
  wake.events = EPOLLIN | EPOLLET;  // an edge for each write: it need not be read
  wake.data.u64 = kWake;
  // Without it the thread would not hear of further requests.
  if (epoll_ctl(epoll_, EPOLL_CTL_ADD, wake_, &wake) != 0 && errno != EEXIST) return false;
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
    if (running_) eventfd_write(wake_, 1);
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
  return !workers_ || workers_->shutDownWithin(end - std::chrono::steady_clock::now());
}

void URLNetwork::stop() {
  static_cast<void>(stopWithin(kStopPatience));
  std::thread thread;
  {
    MutexLock lock(mutex_);
    thread = std::move(thread_);
  }
  if (thread.joinable()) thread.join();
  if (workers_) workers_->shutDown();
}

void URLNetwork::completionHasRun() {
  if (outstanding_.fetch_sub(1) != 1) return;
  MutexLock lock(mutex_);
  changed_.notifyAll();
}

URLFigures URLNetwork::figures() const {
  URLFigures figures;
  figures.started = started_.load();
  figures.completed = completed_.load();
  figures.failed = failed_.load();
  figures.waiting = waiting_.load();
  figures.waitingBytes = waitingBodyBytes_.load();
  figures.droppedWhileWaiting = displaced_.load();
  figures.refused = refused_.load();
  return figures;
}

void URLNetwork::run() {
  beginServiceThread("kyt-network");
  workers_ = std::make_unique<WorkerPool>(completionWorkers(options_));
  sockets_.setEpoll(epoll_);
  now_ = currentTime();
  for (;;) {
    takeCommands();
    deadlines_.fireUntil(now_);
    const bool ends = cancelled_.load();  // before what is there is cancelled, or some of it might be left
    cancelWhatIsUnwanted();
    activateNextInLine();
    emptyRetiredPools();
    endRetiredPools();
    if (ends) {
      MutexLock lock(mutex_);
      if (stopping_ && commands_.empty()) break;
    }
    epoll_event events[64];
    const int count = epoll_wait(epoll_, events, 64, waitingTime());
    now_ = currentTime();
    sockets_.beginTurn();
    if (sockets_.areSomeRefused()) sockets_.watchRefused();
    for (int i = 0; i < count; ++i) handleEvent(events[i].data.u64, events[i].events);
  }
  endRetiredPools();
  while (!sessions_.empty()) {
    const std::shared_ptr<URLSessionState> session = sessions_.first()->self;
    closePool(*session, 0);
    closePool(*session, 1);
  }
  if (curl_) curl_->globalCleanup();
  MutexLock lock(mutex_);
  threadEnds_ = true;
  changed_.notifyAll();
}

// In milliseconds, -1: for ever. What the kernel refuses to watch it is soon asked for again.
int URLNetwork::waitingTime() const {
  const int time = deadlines_.millisecondsFrom(now_);
  constexpr int kSoon = 10;
  return sockets_.areSomeRefused() && (time < 0 || time > kSoon) ? kSoon : time;
}

void URLNetwork::handleEvent(uint64_t which, uint32_t events) {
  if (which == kWake) return;  // commands are taken after every wait
  if (which == kRoutes) {
    routesChanged();
    return;
  }
  const int socket = static_cast<int>(which);
  if (URLConnectionPool* pool = sockets_.poolOf(socket)) {
    pool->socketReady(socket, events);
    if (sockets_.restsAfter(socket, events) && !rest_.isSet()) rest_.set(now_ + kRest);
  }
}

void URLNetwork::takeCommands() {
  {
    MutexLock lock(mutex_);
    if (commands_.empty()) return;
    taken_.swap(commands_);
  }
  for (Command& command : taken_) {
    switch (command.kind) {
      case Kind::start:
        begin(std::move(command.transfer));
        break;
      case Kind::cancel:
        if (command.transfer->phase != URLTransfer::Phase::done)
          fail(*command.transfer, kURLErrorCancelled, "The request was cancelled");
        break;
      case Kind::invalidate:
        for (const auto& pool : command.session->pools)
          if (pool) pool->closeIfIdle();
        break;
    }
  }
  taken_.clear();
}

void URLNetwork::begin(std::shared_ptr<URLTransfer> transfer) {
  URLTransfer& begun = *transfer;
  URLSessionState& session = *begun.session;
  begun.self = std::move(transfer);
  session.transfers.append(begun);
  if (!session.self) {
    session.self = begun.session;
    sessions_.append(session);
  }
  begun.started = now_;
  if (begun.refusal == URLTransfer::Refusal::invalidated || cancelled_.load()) {
    fail(begun, kURLErrorCancelled, "The URL session was invalidated");
  } else if (begun.request.isAwaited && awaitedCancelled_.load()) {
    fail(begun, kURLErrorCancelled, "The request was cancelled");
  } else if (begun.refusal == URLTransfer::Refusal::tooMuch) {
    refuse(begun);
  } else if (!namesItsScheme(begun.request.url)) {
    fail(begun, CURLE_UNSUPPORTED_PROTOCOL, "The address begins neither with https:// nor with http://");
  } else if (!curl_ && !loadCurl()) {
    fail(begun, CURLE_FAILED_INIT, "The HTTP library cannot be loaded");
  } else {
    activate(begun);
  }
}

// Tried anew by each request: a library that is being replaced is missing for a moment only.
bool URLNetwork::loadCurl() {
  auto loaded = CurlLibrary::load(options_.library.c_str());
  if (const auto* problem = std::get_if<std::string>(&loaded)) {
    if (std::exchange(curlProblem_, *problem) != *problem)
      log_.error("CurlURLSession(start): cannot load the HTTP library: %s", problem->c_str());
    return false;
  }
  curl_ = std::get<CurlLibrary>(loaded);
  static_cast<void>(giveBackCodePages());
  return true;
}

void URLNetwork::refuse(URLTransfer& transfer) {
  refused_.fetch_add(1, std::memory_order_relaxed);
  if (counters_.addAndMayLog(Reason::outstandingBytesExceeded, now_)) {
    log_.error(
        "CurlURLSession(start): more than %zu bytes of requests are outstanding, refusing further ones",
        Limits::maxOutstandingBytes);
  }
  fail(transfer, kURLErrorOutstandingTooMuch, "Too much was outstanding");
}

void URLNetwork::countReplyWithoutRoom() {
  if (!counters_.addAndMayLog(Reason::outstandingBytesExceeded, now_)) return;
  log_.error("CurlURLSession(receiveBody): no room for a reply, it is broken off");
}

void URLNetwork::activate(URLTransfer& transfer) {
  if (!lines_.mayGo(transfer)) {
    transfer.phase = URLTransfer::Phase::inLine;
    return;
  }
  URLConnectionPool& pool = poolFor(transfer);
  transfer.clearReply();
  transfer.lastProgress = now_;
  transfer.latestEnd = now_ + options_.requestTime +
                       std::chrono::seconds(transfer.request.body.size() / Limits::leastBodyBytesPerSecond);
  transfer.lostLook = MonotonicTime::max();
  transfer.routesWhenActivated = routeChanges_;
  const CURLcode code = pool.add(transfer);
  if (code != CURLE_OK) {
    lines_.hasGone(transfer);
    pool.closeIfIdle();
    fail(transfer, code, curl_->easyErrorText(code));
    return;
  }
  transfer.phase = URLTransfer::Phase::active;
  armDeadline(transfer);
}

void URLNetwork::activateNextInLine() {
  while (const std::shared_ptr<URLTransfer> next = lines_.next()) activate(*next);
}

void URLNetwork::armDeadline(URLTransfer& transfer) {
  const bool active = transfer.phase == URLTransfer::Phase::active;
  MonotonicTime soonest = active ? transfer.lastProgress + options_.noProgressTimeout : MonotonicTime::max();
  if (active) soonest = std::min({soonest, transfer.lostLook, transfer.latestEnd});
  if (transfer.request.timeout) soonest = std::min(soonest, transfer.started + *transfer.request.timeout);
  if (soonest == MonotonicTime::max()) {
    transfer.deadline.cancel();
  } else {
    transfer.deadline.set(soonest);
  }
}

void URLNetwork::withdraw(URLTransfer& transfer) {
  if (transfer.phase == URLTransfer::Phase::active) lines_.hasGone(transfer);
  if (transfer.handle != nullptr) transfer.pool->remove(transfer);
  if (transfer.phase == URLTransfer::Phase::waiting) stopWaiting(transfer);
  transfer.deadline.cancel();
  transfer.phase = URLTransfer::Phase::submitted;
}

void URLNetwork::fail(URLTransfer& transfer, int32_t code, std::string description) {
  transfer.takeError(code, std::move(description));
  withdraw(transfer);
  failed_.fetch_add(1, std::memory_order_relaxed);
  finish(transfer);
}

void URLNetwork::finish(URLTransfer& transfer) {
  URLSessionState& session = *transfer.session;
  transfer.phase = URLTransfer::Phase::done;
  session.transfers.remove(transfer);
  transfer.user->giveBack(std::exchange(transfer.outstandingCharge, 0));
  transfer.request.body = {};
  if (!session.queue) session.queue = SerialQueue::create("URL session", *workers_);
  const std::shared_ptr<SerialQueue> queue = session.queue;
  const std::shared_ptr<URLTransfer> delivered = std::move(transfer.self);
  unlistIfUnused(session);
  queue->async([delivered] { delivered->deliver(); });
}

void URLNetwork::cancelWhatIsUnwanted() {
  if (cancelled_.load()) {
    cancelRequests(Which::all);
  } else if (awaitedCancelled_.load() && !std::exchange(awaitedGone_, true)) {
    cancelRequests(Which::awaited);
  }
}

void URLNetwork::cancelRequests(Which which) {
  for (URLSessionState* session = sessions_.first(); session != nullptr;) {
    URLSessionState* nextSession = session->links.next;
    const std::shared_ptr<URLSessionState> kept = session->self;  // while its last request goes
    for (URLTransfer* transfer = session->transfers.first(); transfer != nullptr;) {
      URLTransfer* next = transfer->links.next;
      if (which == Which::all || transfer->request.isAwaited)
        fail(*transfer, kURLErrorCancelled, "The request was cancelled");
      transfer = next;
    }
    session = nextSession;
  }
}

void URLNetwork::closePool(URLSessionState& session, size_t number) {
  session.pools[number].reset();
  unlistIfUnused(session);
}

void URLNetwork::unlistIfUnused(URLSessionState& session) {
  if (!session.self || !session.transfers.empty() || session.pools[0] || session.pools[1]) return;
  sessions_.remove(session);
  const std::shared_ptr<URLSessionState> last = std::move(session.self);
  if (sessions_.empty() && options_.whenQuiet != nullptr) quiet_.set(now_ + options_.quietTime);
}

}  // namespace kyt
