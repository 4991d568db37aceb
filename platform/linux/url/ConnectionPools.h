// The connection pools of all sessions: which one a request goes through, which are kept while they idle, and what becomes
// of those whose connections are dead or lead nowhere. Network thread only.
#pragma once

#include <algorithm>
#include <cstddef>
#include <memory>
#include <utility>
#include <vector>

#include "platform/base/Function.h"
#include "platform/linux/url/LinkedList.h"
#include "platform/linux/url/RouteWatch.h"
#include "platform/linux/url/URLConnectionPool.h"

namespace kyt {

class URLRequests;
class URLTransfer;
struct URLSessionState;

// The pools that are idle, longest first; the number of connections in them has a limit.
class IdlePools {
 public:
  explicit IdlePools(size_t most) : most_(most) {}
  void add(URLConnectionPool& pool) {
    pools_.append(pool);
    pool.keptConnections = std::max<size_t>(pool.connections(), 1);
    count_ += pool.keptConnections;
  }
  void remove(URLConnectionPool& pool) {
    if (pool.keptConnections == 0) return;
    pools_.remove(pool);
    count_ -= std::exchange(pool.keptConnections, 0);
  }
  // The one that has to leave to keep the limit, and has; or null.
  [[nodiscard]] URLConnectionPool* takeSurplus() {
    if (count_ <= most_) return nullptr;
    URLConnectionPool* surplus = pools_.first();
    remove(*surplus);
    return surplus;
  }

 private:
  const size_t most_;
  size_t count_ = 0;  // connections
  LinkedList<URLConnectionPool> pools_;
};

class ConnectionPools {
 public:
  ConnectionPools(URLRequests& requests, NetworkTools& tools, RouteWatch& routes)
      : requests_(requests), tools_(tools), routes_(routes), idle_(tools.options.maxIdleConnections) {}

  // The session's connections, or new ones when those would not lead to the server any more.
  [[nodiscard]] URLConnectionPool& poolFor(URLTransfer& transfer);
  [[nodiscard]] IdlePools& idle() { return idle_; }
  // Looks where all connections lead that are not a session's any more, or those of this session; retires its pools where
  // a new connection would leave otherwise.
  void judgeRetired();
  void judge(URLSessionState& session);
  // No new request goes through the pool that it is in.
  void retirePoolOf(const URLTransfer& transfer);
  // What has not begun in a retired pool would begin on a connection that is dead, or wait for one.
  void takeOutWhatHasNotBegun(Function<void(URLTransfer&)> goAgain);
  // Ends those without requests. Not called by a pool: whoever retires one may have been.
  void endRetired();

 private:
  void retire(std::unique_ptr<URLConnectionPool>& pool);

  URLRequests& requests_;
  NetworkTools& tools_;
  RouteWatch& routes_;
  IdlePools idle_;
  std::vector<std::unique_ptr<URLConnectionPool>> retired_;
};

}  // namespace kyt
