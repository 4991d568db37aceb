// The network thread's requests that wait for connectivity: which failures count as being offline, what wakes
// a request, and what gives way when too much waits.
#include <sys/epoll.h>

#include <algorithm>
#include <cerrno>

#include "platform/base/Limits.h"
#include "platform/linux/url/URLNetwork.h"

namespace kyt {
namespace {

constexpr uint64_t kRoutes = ~uint64_t{0} - 1;
constexpr Duration kSettleTime = std::chrono::milliseconds(50);
// The network may come back between an attempt and the question why it failed; then it is tried again at
// once, but not for ever: a router may claim what the route table denies.
constexpr uint8_t kImmediateRetries = 3;
// What a waiting request counts at least: the request itself costs memory too, however small its body.
constexpr size_t kLeastCharge = 1024;

// Of an attempt of which not a byte was sent.
bool mayComeOfBeingOffline(CURLcode code) {
  switch (code) {
    case CURLE_COULDNT_CONNECT:
    case CURLE_COULDNT_RESOLVE_HOST:
    case CURLE_OPERATION_TIMEDOUT:
    case CURLE_SSL_CONNECT_ERROR:
    case CURLE_SEND_ERROR:
    case CURLE_RECV_ERROR:
      return true;
    default:
      return false;
  }
}

bool saysNoRoute(long systemError) {
  return systemError == ENETUNREACH || systemError == EHOSTUNREACH || systemError == ENETDOWN;
}

}  // namespace

bool URLNetwork::retryOrWait(URLTransfer& transfer, CURLcode code, long systemError) {
  if (!transfer.session->configuration.waitsForConnectivity) return false;
  if (!mayComeOfBeingOffline(code)) return false;
  if (code == CURLE_COULDNT_RESOLVE_HOST) transfer.addresses.clear();
  if (!canLeave(transfer)) {
    setAside(transfer);
    return true;
  }
  bool wasOffline = saysNoRoute(systemError);
  if (code == CURLE_COULDNT_RESOLVE_HOST) wasOffline = transfer.immediateRetries == 0;
  // What had been tried from an address that is no more, or over another way, says nothing of now.
  if (transfer.routesWhenActivated != routeChanges_ && systemError != ECONNREFUSED) wasOffline = true;
  if (!wasOffline || transfer.immediateRetries >= kImmediateRetries) return false;
  ++transfer.immediateRetries;
  activate(transfer);
  return true;
}

bool URLNetwork::canLeave(const URLTransfer& transfer) {
  if (transfer.addresses.empty()) return routes_.canResolve();
  return std::any_of(transfer.addresses.begin(), transfer.addresses.end(),
                     [&](const sockaddr_storage& address) {
                       return routes_.isReachable(reinterpret_cast<const sockaddr&>(address),
                                                  !transfer.request.allowsCellularAccess);
                     });
}

void URLNetwork::setAside(URLTransfer& transfer) {
  URLSessionState& session = *transfer.session;
  transfer.phase = URLTransfer::Phase::waiting;
  // Headers may be large too: they carry names that clients choose.
  transfer.waitingCharge = std::max(transfer.request.body.size() + transfer.headerSize(), kLeastCharge);
  WaitingRequests& waiting = session.waiting[transfer.user];
  waiting.transfers.append(transfer);
  waiting.bytes += transfer.waitingCharge;
  waiting_.fetch_add(1, std::memory_order_relaxed);
  waitingBodyBytes_.fetch_add(transfer.request.body.size(), std::memory_order_relaxed);
  armDeadline(transfer);
  const std::shared_ptr<URLSessionState> kept = transfer.session;  // displacing may end its last request
  const bool listening = routeEvents_.descriptor() >= 0;
  // The list ends with its last request, which one that is larger than the limit is too.
  const size_t most = transfer.user->mostWaiting();
  while (waiting.bytes > most) {
    const bool last = waiting.transfers.first() == &transfer;
    displace(*waiting.transfers.first());
    if (last) break;
  }
  listenForRoutes();
  if (listening) return;
  // What changed before the subscription was not announced.
  if (!settle_.isSet()) settle_.set(now_ + kSettleTime);
}

void URLNetwork::displace(URLTransfer& oldest) {
  displaced_.fetch_add(1, std::memory_order_relaxed);
  if (counters_.addAndMayLog(Reason::waitingRequestDisplaced, now_)) {
    log_.error(
        "CurlURLSession(setAside): more than %zu bytes wait for connectivity, dropping the oldest request",
        oldest.user->mostWaiting());
  }
  fail(oldest, kURLErrorWaitingTooMuch, "Too much was waiting for connectivity");
}

void URLNetwork::stopWaiting(URLTransfer& transfer) {
  const auto waiting = transfer.session->waiting.find(transfer.user);
  waiting->second.transfers.remove(transfer);
  waiting->second.bytes -= std::exchange(transfer.waitingCharge, 0);
  if (waiting->second.transfers.empty()) transfer.session->waiting.erase(waiting);
  waitingBodyBytes_.fetch_sub(transfer.request.body.size(), std::memory_order_relaxed);
  if (waiting_.fetch_sub(1, std::memory_order_relaxed) != 1) return;
  // Unsubscribing here would subscribe anew for each failed attempt: the slow timer does it when nothing
  // waits.
}

void URLNetwork::listenForRoutes() {
  if (!slowRetry_.isSet()) slowRetry_.set(now_ + options_.waitingRetryPeriod);
  if (routeEvents_.descriptor() >= 0) return;
  epoll_event event{};
  event.events = EPOLLIN;
  event.data.u64 = kRoutes;
  const bool hears =
      routeEvents_.subscribe() && epoll_ctl(epoll_, EPOLL_CTL_ADD, routeEvents_.descriptor(), &event) == 0;
  // Otherwise again with the next request; until then each of them, and the slow timer, looks by itself.
  if (!hears) routeEvents_.unsubscribe();
  if (std::exchange(isDeaf_, !hears) && hears) noteRouteChanges();
}

void URLNetwork::waitingTimer() {
  if (waiting_.load(std::memory_order_relaxed) == 0 && sessions_.empty()) {
    routeEvents_.unsubscribe();
    return;
  }
  slowRetry_.set(now_ + options_.waitingRetryPeriod);
  if (isDeaf_) noteRouteChanges();
  retryWaiting(true);
}

// What is asked about the same servers is asked once: thousands of sessions may wait for one.
class URLNetwork::Answers {
 public:
  explicit Answers(URLNetwork& network) : network_(network) {}
  bool canLeave(const URLTransfer& transfer) {
    if (transfer.addresses.empty()) {
      if (!std::exchange(namesAsked_, true)) namesCanBeKnown_ = network_.canLeave(transfer);
      return namesCanBeKnown_;
    }
    const auto bytes = [](const URLTransfer& one) {
      return std::string_view(reinterpret_cast<const char*>(one.addresses.data()),
                              one.addresses.size() * sizeof one.addresses[0]);
    };
    const bool cellular = transfer.request.allowsCellularAccess;
    for (const Known& known : known_)
      if (known.cellular == cellular && known.addresses == bytes(transfer)) return known.canLeave;
    const bool answer = network_.canLeave(transfer);
    if (known_.size() < kMostKnown) known_.push_back({std::string(bytes(transfer)), cellular, answer});
    return answer;
  }

 private:
  static constexpr size_t kMostKnown = 16;
  struct Known {
    std::string addresses;
    bool cellular, canLeave;
  };
  URLNetwork& network_;
  bool namesAsked_ = false, namesCanBeKnown_ = false;
  std::vector<Known> known_;
};

void URLNetwork::retryWaiting(bool evenIfNamesSeemUnknowable) {
  Answers answers(*this);
  for (URLSessionState* session = sessions_.first(); session != nullptr;) {
    URLSessionState* nextSession = session->links.next;
    const std::shared_ptr<URLSessionState> kept =
        session->transfers.empty() ? nullptr : session->transfers.first()->session;
    for (URLTransfer* transfer = session->transfers.first(); transfer != nullptr;) {
      URLTransfer* next = transfer->links.next;
      const bool unknown = evenIfNamesSeemUnknowable && transfer->addresses.empty();
      if (transfer->phase == URLTransfer::Phase::waiting && (unknown || answers.canLeave(*transfer))) {
        withdraw(*transfer);
        transfer->immediateRetries = 0;
        activate(*transfer);
      }
      transfer = next;
    }
    session = nextSession;
  }
}

}  // namespace kyt
