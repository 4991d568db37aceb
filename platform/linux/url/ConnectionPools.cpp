#include "platform/linux/url/ConnectionPools.h"

#include "platform/linux/url/URLSessionState.h"
#include "platform/linux/url/URLTransfer.h"

namespace kyt {

// Looking for events costs a system call; that they were not handled yet must not send the request nowhere.
URLConnectionPool& ConnectionPools::poolFor(URLTransfer& transfer) {
  URLSessionState& session = *transfer.session;
  std::unique_ptr<URLConnectionPool>& pool = session.pools[transfer.request.allowsCellularAccess ? 0 : 1];
  routes_.takeEventsOrSuspectSome();
  if (pool && pool->routesWhenJudged != routes_.changes() && !pool->judgeConnections(routes_.changes()))
    retire(pool);
  if (!pool) {
    pool = std::make_unique<URLConnectionPool>(requests_, tools_, session, &pool - session.pools);
    pool->routesWhenJudged = routes_.changes();
    routes_.listen();
  }
  return *pool;
}

void ConnectionPools::judgeRetired() {
  for (const auto& pool : retired_) static_cast<void>(pool->judgeConnections(routes_.changes()));
}

void ConnectionPools::judge(URLSessionState& session) {
  for (auto& pool : session.pools)
    if (pool && !pool->judgeConnections(routes_.changes())) retire(pool);
}

void ConnectionPools::retire(std::unique_ptr<URLConnectionPool>& pool) {
  pool->retire();
  retired_.push_back(std::move(pool));
}

void ConnectionPools::retirePoolOf(const URLTransfer& transfer) {
  for (auto& pool : transfer.session->pools)
    if (pool && pool.get() == transfer.pool) retire(pool);
}

void ConnectionPools::takeOutWhatHasNotBegun(Function<void(URLTransfer&)> goAgain) {
  for (size_t i = 0; i < retired_.size(); ++i) {  // there may be more
    URLConnectionPool& pool = *retired_[i];
    if (pool.isEmpty() || std::exchange(pool.isSearched, true)) continue;
    const std::shared_ptr<URLSessionState> kept = pool.session().self;
    for (URLTransfer* transfer = kept->transfers.first(); transfer != nullptr;) {
      URLTransfer* next = transfer->links.next;
      if (transfer->pool == &pool && !transfer->attempt.hasBegun) goAgain(*transfer);
      transfer = next;
    }
  }
}

void ConnectionPools::endRetired() {
  std::erase_if(retired_, [](const auto& pool) { return pool->isEmpty(); });
}

}  // namespace kyt
