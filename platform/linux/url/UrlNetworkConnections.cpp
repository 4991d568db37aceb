// The network thread's connections that are dead or lead nowhere, and the requests that were on them. A request goes
// again only where the server's TCP has acknowledged not a byte of it.
#include <algorithm>

#include "platform/linux/url/UrlNetwork.h"

namespace kyt {
namespace {

constexpr Duration kSettleTime = std::chrono::milliseconds(50);
// A connection may break at once each time; then the failure is the caller's.
constexpr uint8_t kMostRepeats = 3;
// How long an acknowledgement may take before a request on a connection without a way to its server goes back: the
// network may be gone for a moment only, and the server may have what it got just before.
constexpr Duration kLostPatience = std::chrono::seconds(2);

}  // namespace

bool URLNetwork::goAgainOrWait(URLTransfer& transfer) {
  if (transfer.session->configuration.waitsForConnectivity && !canLeave(transfer)) {
    setAside(transfer);
    return true;
  }
  if (transfer.immediateRetries >= kMostRepeats) return false;
  ++transfer.immediateRetries;
  activate(transfer);
  return true;
}

// The connection may be dead, so nothing more begins on it.
void URLNetwork::stuck(URLTransfer& transfer) {
  const bool unheard = transfer.hasBegun && transfer.isUnheard();
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

// Not sooner: whoever retires one may have been called by it.
void URLNetwork::endRetiredPools() {
  std::erase_if(retired_, [](const auto& pool) { return pool->isEmpty(); });
}

}  // namespace kyt
