#include "platform/linux/url/URLRequests.h"

#include <strings.h>

#include <algorithm>
#include <chrono>
#include <utility>
#include <variant>

#include "platform/base/Limits.h"
#include "platform/base/ServerRecords.h"
#include "platform/linux/base/CodePages.h"

namespace kyt {
namespace {

// libcurl takes an address without a scheme, or with a single slash behind it, for one over plain http: what
// forces https by looking at the scheme would not see it.
bool namesItsScheme(const std::string& url) {
  return strncasecmp(url.c_str(), "http://", 7) == 0 || strncasecmp(url.c_str(), "https://", 8) == 0;
}

}  // namespace

URLRequests::URLRequests(NetworkTools& tools, Completions& completions)
    : tools_(tools),
      completions_(completions),
      lines_(tools.options.maxActiveRequests, tools.options.maxActiveRequestsToOneServer),
      routes_(tools, {[this] { routesSettled(); }, [this] { waiting_.retry(sessions_, true); },
                      [this] { return !waiting_.empty() || !sessions_.empty() || watcher() != nullptr; }}),
      pools_(*this, tools, routes_),
      waiting_(tools, {[this](URLTransfer& oldest) { displace(oldest); },
                       [this](URLTransfer& transfer) {
                         withdraw(transfer);
                         transfer.immediateRetries = 0;
                         activate(transfer);
                       },
                       [this](const URLTransfer& transfer) { return canLeave(transfer); }}),
      ends_(*this, tools, pools_, routes_),
      quiet_(Deadline::calling<&URLRequests::beQuiet>(tools.deadlines, *this)) {}

void URLRequests::beQuiet() {
  if (sessions_.empty()) tools_.options.whenQuiet();
}

void URLRequests::begin(std::shared_ptr<URLTransfer> transfer) {
  URLTransfer& begun = *transfer;
  URLSessionState& session = *begun.session;
  begun.self = std::move(transfer);
  session.transfers.append(begun);
  if (!session.self) {
    session.self = begun.session;
    sessions_.append(session);
  }
  begun.started = tools_.now;
  if (begun.refusal == URLTransfer::Refusal::invalidated || noneWanted_) {
    fail(begun, kURLErrorCancelled, "The URL session was invalidated");
  } else if (begun.request.isAwaited && noneAwaitedWanted_) {
    fail(begun, kURLErrorCancelled, "The request was cancelled");
  } else if (begun.refusal == URLTransfer::Refusal::tooMuch) {
    refuse(begun);
  } else if (!namesItsScheme(begun.request.url)) {
    fail(begun, CURLE_UNSUPPORTED_PROTOCOL, "The address begins neither with https:// nor with http://");
  } else if (!tools_.curl && !loadCurl()) {
    fail(begun, CURLE_FAILED_INIT, "The HTTP library cannot be loaded");
  } else {
    activate(begun);
  }
}

// Tried anew by each request: a library that is being replaced is missing for a moment only.
bool URLRequests::loadCurl() {
  auto loaded = CurlLibrary::load(tools_.options.library.c_str());
  if (const auto* problem = std::get_if<std::string>(&loaded)) {
    if (std::exchange(curlProblem_, *problem) != *problem)
      tools_.log.error("CurlURLSession(start): cannot load the HTTP library: %s", problem->c_str());
    return false;
  }
  tools_.curl = std::get<CurlLibrary>(loaded);
  static_cast<void>(giveBackCodePages());
  return true;
}

void URLRequests::refuse(URLTransfer& transfer) {
  tools_.figures.add(&URLFigures::refused);
  if (tools_.counters.addAndMayLog(Reason::outstandingBytesExceeded, tools_.now)) {
    tools_.log.error(
        "CurlURLSession(start): more than %zu bytes of requests are outstanding, refusing further ones",
        Limits::maxOutstandingBytes);
  }
  fail(transfer, kURLErrorOutstandingTooMuch, "Too much was outstanding");
}

void URLRequests::countReplyWithoutRoom() {
  if (!tools_.counters.addAndMayLog(Reason::outstandingBytesExceeded, tools_.now)) return;
  tools_.log.error("CurlURLSession(receiveBody): no room for a reply, it is broken off");
}

void URLRequests::displace(URLTransfer& oldest) {
  tools_.figures.add(&URLFigures::droppedWhileWaiting);
  if (tools_.counters.addAndMayLog(Reason::waitingRequestDisplaced, tools_.now)) {
    tools_.log.error(
        "CurlURLSession(setAside): more than %zu bytes wait for connectivity, dropping the oldest request",
        oldest.user.mostWaiting());
  }
  fail(oldest, kURLErrorWaitingTooMuch, "Too much was waiting for connectivity");
}

void URLRequests::activate(URLTransfer& transfer) {
  if (lines_.mayGo(transfer)) return go(transfer);
  transfer.phase = URLTransfer::Phase::inLine;
}

void URLRequests::activateAgain(URLTransfer& transfer) {
  lines_.goesAgain(transfer);
  go(transfer);
}

void URLRequests::go(URLTransfer& transfer) {
  URLConnectionPool& pool = pools_.poolFor(transfer);
  transfer.clearAttempt();
  transfer.attempt.lastProgress = tools_.now;
  transfer.attempt.latestEnd =
      tools_.now + tools_.options.requestTime +
      std::chrono::seconds(transfer.request.body.size() / Limits::leastBodyBytesPerSecond);
  transfer.attempt.routes = routes_.changes();
  const CURLcode code = pool.add(transfer);
  if (code != CURLE_OK) {
    lines_.hasGone(transfer);
    pool.closeIfIdle();
    fail(transfer, code, tools_.curl->easyErrorText(code));
    return;
  }
  transfer.phase = URLTransfer::Phase::active;
  armDeadline(transfer);
}

void URLRequests::activateNextInLine() {
  while (const std::shared_ptr<URLTransfer> next = lines_.next()) go(*next);
}

bool URLRequests::canLeave(const URLTransfer& transfer) {
  const std::vector<sockaddr_storage>& addresses = transfer.attempt.addresses;
  if (addresses.empty()) return tools_.routes.canResolve();
  return std::any_of(addresses.begin(), addresses.end(), [&](const sockaddr_storage& address) {
    return tools_.routes.isReachable(reinterpret_cast<const sockaddr&>(address),
                                     !transfer.request.allowsCellularAccess);
  });
}

void URLRequests::setAside(URLTransfer& transfer) {
  const bool listening = routes_.isListening();
  armDeadline(transfer);
  waiting_.add(transfer);
  routes_.listen();
  if (!listening) routes_.settleSoon();  // what changed before the subscription was not announced
}

void URLRequests::routesSettled() {
  pools_.judgeRetired();
  for (URLSessionState* session = sessions_.first(); session != nullptr;) {
    URLSessionState* next = session->links.next;
    const std::shared_ptr<URLSessionState> kept = session->self;
    pools_.judge(*session);
    unlistIfUnused(*session);
    session = next;
  }
  waiting_.retry(sessions_, false);
  if (const auto changed = watcher()) (*changed)();
}

void URLRequests::watchConnectivity(std::shared_ptr<Function<void()>> changed) {
  MutexLock lock(watcherMutex_);
  watcher_ = std::move(changed);
}

std::shared_ptr<Function<void()>> URLRequests::watcher() {
  MutexLock lock(watcherMutex_);
  return watcher_;
}

void URLRequests::emptyRetiredPools() {
  pools_.takeOutWhatHasNotBegun([this](URLTransfer& transfer) {
    withdraw(transfer);
    activateAgain(transfer);
  });
  pools_.endRetired();
}

void URLRequests::armDeadline(URLTransfer& transfer) {
  const bool active = transfer.phase == URLTransfer::Phase::active;
  const URLTransfer::Attempt& attempt = transfer.attempt;
  MonotonicTime soonest = MonotonicTime::max();
  if (active)
    soonest = std::min(
        {attempt.lastProgress + tools_.options.noProgressTimeout, attempt.lostLook, attempt.latestEnd});
  if (transfer.request.timeout) soonest = std::min(soonest, transfer.started + *transfer.request.timeout);
  if (soonest == MonotonicTime::max()) {
    transfer.deadline.cancel();
  } else {
    transfer.deadline.set(soonest);
  }
}

void URLRequests::withdraw(URLTransfer& transfer) {
  if (transfer.phase == URLTransfer::Phase::active) lines_.hasGone(transfer);
  if (transfer.handle != nullptr) transfer.pool->remove(transfer);
  if (transfer.phase == URLTransfer::Phase::waiting) waiting_.remove(transfer);
  transfer.deadline.cancel();
  transfer.phase = URLTransfer::Phase::submitted;
}

namespace {

int64_t secondsNow() {
  return std::chrono::duration_cast<std::chrono::seconds>(std::chrono::system_clock::now().time_since_epoch())
      .count();
}

// Whether the failure says something about the server.
bool isOfTheServer(int32_t code) {
  return code > 0 && code != CURLE_FAILED_INIT;
}

}  // namespace

void URLRequests::succeed(URLTransfer& transfer, int status) {
  if (tools_.options.servers != nullptr)
    tools_.options.servers->answered(transfer.request.url, status, secondsNow());
  withdraw(transfer);
  transfer.takeReply(status);
  tools_.figures.add(&URLFigures::completed);
  finish(transfer);
}

void URLRequests::fail(URLTransfer& transfer, int32_t code, std::string description) {
  if (tools_.options.servers != nullptr && isOfTheServer(code))
    tools_.options.servers->failed(transfer.request.url, description, secondsNow());
  transfer.takeError(code, std::move(description));
  withdraw(transfer);
  tools_.figures.add(&URLFigures::failed);
  finish(transfer);
}

void URLRequests::finish(URLTransfer& transfer) {
  URLSessionState& session = *transfer.session;
  transfer.phase = URLTransfer::Phase::done;
  session.transfers.remove(transfer);
  transfer.user.giveBack(std::exchange(transfer.outstandingCharge, 0));
  transfer.request.body = {};
  std::shared_ptr<URLTransfer> finished = std::move(transfer.self);
  unlistIfUnused(session);
  completions_.run(std::move(finished));
}

void URLRequests::cancel(URLTransfer& transfer) {
  if (transfer.phase != URLTransfer::Phase::done)
    fail(transfer, kURLErrorCancelled, "The request was cancelled");
}

void URLRequests::cancelUnwanted() {
  if (noneWanted_) {
    cancelThose(false);
  } else if (noneAwaitedWanted_ && !std::exchange(awaitedGone_, true)) {
    cancelThose(true);
  }
}

void URLRequests::cancelThose(bool onlyAwaited) {
  for (URLSessionState* session = sessions_.first(); session != nullptr;) {
    URLSessionState* nextSession = session->links.next;
    const std::shared_ptr<URLSessionState> kept = session->self;  // while its last request goes
    for (URLTransfer* transfer = session->transfers.first(); transfer != nullptr;) {
      URLTransfer* next = transfer->links.next;
      if (!onlyAwaited || transfer->request.isAwaited) cancel(*transfer);
      transfer = next;
    }
    session = nextSession;
  }
}

void URLRequests::closePool(URLSessionState& session, size_t number) {
  session.pools[number].reset();
  unlistIfUnused(session);
}

void URLRequests::closeAllPools() {
  pools_.endRetired();
  while (!sessions_.empty()) {
    const std::shared_ptr<URLSessionState> session = sessions_.first()->self;
    closePool(*session, 0);
    closePool(*session, 1);
  }
}

void URLRequests::unlistIfUnused(URLSessionState& session) {
  if (!session.self || !session.transfers.empty() || session.pools[0] || session.pools[1]) return;
  sessions_.remove(session);
  const std::shared_ptr<URLSessionState> last = std::move(session.self);
  if (sessions_.empty() && tools_.options.whenQuiet != nullptr)
    quiet_.set(tools_.now + tools_.options.quietTime);
}

}  // namespace kyt
