// The network thread's connections: which a request begins on, how it ends, and what becomes of those that are dead or
// lead nowhere and of the requests on them. A request goes again only where the server's TCP has acknowledged not a
// byte of it.
#include <algorithm>

#include "platform/linux/url/URLNetwork.h"

namespace kyt {
namespace {

constexpr Duration kSettleTime = std::chrono::milliseconds(50);
// A connection may break at once each time; then the failure is the caller's.
constexpr uint8_t kMostRepeats = 3;
// How long an acknowledgement may take before a request on a connection without a way to its server goes back: the
// network may be gone for a moment only, and the server may have what it got just before.
constexpr Duration kLostPatience = std::chrono::seconds(2);

}  // namespace

// The session's connections, or new ones when those would not lead to the server any more. Looking for events costs a
// system call; that they were not handled yet must not send the request nowhere.
URLConnectionPool& URLNetwork::poolFor(URLTransfer& transfer) {
  URLSessionState& session = *transfer.session;
  std::unique_ptr<URLConnectionPool>& pool = session.pools[transfer.request.allowsCellularAccess ? 0 : 1];
  if (routeEvents_.takeAll()) noteRouteChanges();
  if (isDeaf_) {
    ++routeChanges_;  // for all that is known
    listenForRoutes();
  }
  if (pool && pool->routesWhenJudged != routeChanges_ && !pool->judgeConnections()) retire(pool);
  if (!pool) {
    pool = std::make_unique<URLConnectionPool>(*this, session, &pool - session.pools);
    pool->routesWhenJudged = routeChanges_;
    listenForRoutes();
  }
  return *pool;
}

void URLNetwork::transferDeadline(URLTransfer& transfer) {
  const bool active = transfer.phase == URLTransfer::Phase::active;
  if (transfer.request.timeout && now_ >= transfer.started + *transfer.request.timeout) {
    if (active) retirePoolOf(transfer);
    fail(transfer, CURLE_OPERATION_TIMEDOUT, "The request timed out");
  } else if (active && now_ >= transfer.latestEnd) {
    retirePoolOf(transfer);
    fail(transfer, CURLE_OPERATION_TIMEDOUT, "The request took too long");
  } else if (active && now_ >= transfer.lastProgress + options_.noProgressTimeout) {
    stuck(transfer);
  } else if (active && now_ >= transfer.lostLook) {
    lookAtLostConnection(transfer);
  } else {
    armDeadline(transfer);
  }
}

void URLNetwork::transferEnded(URLTransfer& transfer, CURLcode code) {
  long status = 0, systemError = 0, version = 0;
  curl_->easyGetInfo(transfer.handle, CURLINFO_RESPONSE_CODE, &status);
  curl_->easyGetInfo(transfer.handle, CURLINFO_OS_ERRNO, &systemError);
  curl_->easyGetInfo(transfer.handle, CURLINFO_HTTP_VERSION, &version);
  const std::shared_ptr<URLConnection> connection = transfer.connection;
  if (connection && version == CURL_HTTP_VERSION_1_1) connection->isSilent = true;
  if (transfer.foundEndedConnection) {
    if (!connection->transfers.empty()) retirePoolOf(transfer);  // others may still read from it
    withdraw(transfer);
    if (connection->transfers.empty()) connection->letGo();
    activate(transfer);
    return;
  }
  if (code != CURLE_OK) {
    ended(transfer, code, systemError);
  } else {
    withdraw(transfer);
    transfer.takeReply(static_cast<int>(status));
    completed_.fetch_add(1, std::memory_order_relaxed);
    finish(transfer);
  }
  if (connection) endOthersThatMay(*connection);
}

// One that the server does not have may go again only when nothing of it can arrive any more, so when its connection is
// broken off. That waits for the answers to others.
void URLNetwork::ended(URLTransfer& transfer, CURLcode code, long systemError) {
  const bool unheard = transfer.hasBegun && transfer.isUnheard();
  if (unheard && transfer.sharesItsConnection()) {
    transfer.endedWith = code;
    connectionLost(transfer);
    return;
  }
  const std::shared_ptr<URLConnection> connection = transfer.connection;
  withdraw(transfer);
  if (unheard) connection->abortWhatIsLeft();
  if (unheard ? goAgainOrWait(transfer) : !transfer.hasBegun && retryOrWait(transfer, code, systemError))
    return;
  failWith(transfer, code);
}

void URLNetwork::endOthersThatMay(const URLConnection& connection) {
  for (URLTransfer* other : connection.transfers) {
    if (!other->endedWith) continue;
    other->lostLook = now_;
    armDeadline(*other);
  }
}

void URLNetwork::failWith(URLTransfer& transfer, CURLcode code) {
  if (code == CURLE_WRITE_ERROR && transfer.replyTooLong) code = CURLE_FILESIZE_EXCEEDED;
  if (transfer.onlyCellularRoutes) {
    fail(transfer, code, "The request may not use cellular interfaces, and no other leads to the server");
  } else if (transfer.wasToBeRepeated) {
    fail(transfer, CURLE_GOT_NOTHING, "The connection ended without an answer");
  } else {
    fail(transfer, code, transfer.errorText[0] != 0 ? transfer.errorText : curl_->easyErrorText(code));
  }
}

// The server may have other addresses than the connection's, so whether there is a way is seen by going.
bool URLNetwork::goAgainOrWait(URLTransfer& transfer) {
  if (transfer.immediateRetries < kMostRepeats) {
    ++transfer.immediateRetries;
    activate(transfer);
    return true;
  }
  if (!transfer.session->configuration.waitsForConnectivity || canLeave(transfer)) return false;
  setAside(transfer);
  return true;
}

// The connection may be dead, so nothing more begins on it.
void URLNetwork::stuck(URLTransfer& transfer) {
  const bool unheard = transfer.hasBegun && transfer.isUnheard() && !transfer.sharesItsConnection();
  const std::shared_ptr<URLConnection> connection = transfer.connection;
  retirePoolOf(transfer);
  if (unheard) connection->abort();
  withdraw(transfer);
  if (unheard ? goAgainOrWait(transfer)
              : !transfer.hasBegun && retryOrWait(transfer, CURLE_OPERATION_TIMEDOUT, 0))
    return;
  fail(transfer, CURLE_OPERATION_TIMEDOUT, "The request made no progress");
}

void URLNetwork::connectionLost(URLTransfer& transfer) {
  transfer.lostLook = now_ + kLostPatience;
  armDeadline(transfer);
}

// Others on the same connection of which the server has something would lose their answers: those have until they are
// stuck, in case the way comes back.
void URLNetwork::lookAtLostConnection(URLTransfer& transfer) {
  if (transfer.endedWith) {
    ended(transfer, *transfer.endedWith, 0);
    return;
  }
  const std::shared_ptr<URLConnection> connection = transfer.connection;
  const bool isLost = connection && connection->lostSince;
  const bool goesBack = isLost && std::all_of(connection->transfers.begin(), connection->transfers.end(),
                                              [](URLTransfer* other) { return other->isUnheard(); });
  if (!goesBack) {
    transfer.lostLook = isLost ? now_ + kLostPatience : MonotonicTime::max();
    armDeadline(transfer);
    return;
  }
  connection->abort();
  withdraw(transfer);
  if (!goAgainOrWait(transfer))
    fail(transfer, CURLE_RECV_ERROR, "No way leads from the connection to the server any more");
}

void URLNetwork::routesChanged() {
  if (routeEvents_.takeAll()) noteRouteChanges();
}

void URLNetwork::noteRouteChanges() {
  ++routeChanges_;
  if (!settle_.isSet()) settle_.set(now_ + kSettleTime);
}

void URLNetwork::judgeConnections() {
  for (const auto& pool : retired_) static_cast<void>(pool->judgeConnections());
  for (URLSessionState* session = sessions_.first(); session != nullptr;) {
    URLSessionState* next = session->links.next;
    const std::shared_ptr<URLSessionState> kept = session->self;
    for (auto& pool : session->pools)
      if (pool && !pool->judgeConnections()) retire(pool);
    unlistIfUnused(*session);
    session = next;
  }
}

void URLNetwork::retire(std::unique_ptr<URLConnectionPool>& pool) {
  pool->retire();
  retired_.push_back(std::move(pool));
}

void URLNetwork::retirePoolOf(const URLTransfer& transfer) {
  for (auto& pool : transfer.session->pools)
    if (pool && pool.get() == transfer.pool) retire(pool);
}

// What has not begun there would begin on a connection that is dead, or wait for one.
void URLNetwork::emptyRetiredPools() {
  for (size_t i = 0; i < retired_.size(); ++i) {  // there may be more
    URLConnectionPool& pool = *retired_[i];
    if (pool.isEmpty() || std::exchange(pool.isSearched, true)) continue;
    const std::shared_ptr<URLSessionState> kept = pool.session().self;
    for (URLTransfer* transfer = kept->transfers.first(); transfer != nullptr;) {
      URLTransfer* next = transfer->links.next;
      if (transfer->pool == &pool && !transfer->hasBegun) {
        withdraw(*transfer);
        activate(*transfer);
      }
      transfer = next;
    }
  }
}

// Not sooner: whoever retires one may have been called by it.
void URLNetwork::endRetiredPools() {
  std::erase_if(retired_, [](const auto& pool) { return pool->isEmpty(); });
}

}  // namespace kyt
