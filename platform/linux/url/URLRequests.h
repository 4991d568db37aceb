// The requests of all sessions, from the network thread's side: each begins, stands in line, is on its way or waits for
// connectivity, and is finished once. Network thread only, but where it says otherwise.
#pragma once

#include <atomic>
#include <memory>
#include <string>

#include "platform/base/Function.h"
#include "platform/base/Mutex.h"
#include "platform/linux/url/Completions.h"
#include "platform/linux/url/ConnectionPools.h"
#include "platform/linux/url/LinkedList.h"
#include "platform/linux/url/NetworkTools.h"
#include "platform/linux/url/RequestEnds.h"
#include "platform/linux/url/RequestLines.h"
#include "platform/linux/url/RouteWatch.h"
#include "platform/linux/url/URLSessionState.h"
#include "platform/linux/url/URLTransfer.h"
#include "platform/linux/url/WaitingRequests.h"

namespace kyt {

class URLRequests {
 public:
  URLRequests(NetworkTools& tools, Completions& completions);
  URLRequests(const URLRequests&) = delete;
  URLRequests& operator=(const URLRequests&) = delete;

  // Any thread: all requests, or those that threads wait for, are wanted no more. None can begin from now on, and
  // cancelUnwanted() ends those that there are.
  void wantNone() { noneWanted_ = true; }
  void wantNoneAwaited() { noneAwaitedWanted_ = true; }
  [[nodiscard]] bool isNoneWanted() const { return noneWanted_; }
  // Any thread: see URLSessionFactory::watchConnectivity.
  void watchConnectivity(std::shared_ptr<Function<void()>> changed) EXCLUDES(watcherMutex_);

  // What the event loop does.
  void begin(std::shared_ptr<URLTransfer> transfer);
  void cancel(URLTransfer& transfer);
  void cancelUnwanted();
  void activateNextInLine();
  void emptyRetiredPools();
  void closeAllPools();  // no request is left
  [[nodiscard]] RouteWatch& routes() { return routes_; }

  // What pools and transfers tell or ask.
  void closePool(URLSessionState& session, size_t number);
  void countReplyWithoutRoom();
  [[nodiscard]] RequestEnds& ends() { return ends_; }
  [[nodiscard]] ConnectionPools& pools() { return pools_; }

  // How a request goes on, or ends.
  void activate(URLTransfer& transfer);       // or puts it in line
  void activateAgain(URLTransfer& transfer);  // one that was on its way until a moment ago
  void setAside(URLTransfer& transfer);       // it waits for connectivity
  void withdraw(URLTransfer& transfer);       // from its pool, or from the waiting ones
  void succeed(URLTransfer& transfer, int status);
  void fail(URLTransfer& transfer, int32_t code, std::string description);
  void armDeadline(URLTransfer& transfer);
  // Whether a packet to its server would leave now.
  [[nodiscard]] bool canLeave(const URLTransfer& transfer);

 private:
  [[nodiscard]] bool loadCurl();
  void go(URLTransfer& transfer);  // it has been counted
  void refuse(URLTransfer& transfer);
  void displace(URLTransfer& oldest);
  void finish(URLTransfer& transfer);  // its result is set
  void unlistIfUnused(URLSessionState& session);
  void cancelThose(bool onlyAwaited);
  void routesSettled();
  void beQuiet();
  [[nodiscard]] std::shared_ptr<Function<void()>> watcher() EXCLUDES(watcherMutex_);

  std::atomic<bool> noneWanted_{false}, noneAwaitedWanted_{false};  // self-synchronised
  Mutex watcherMutex_;
  std::shared_ptr<Function<void()>> watcher_ GUARDED_BY(watcherMutex_);

  NetworkTools& tools_;
  Completions& completions_;
  bool awaitedGone_ = false;              // those there were when they were cancelled
  std::string curlProblem_;               // the last one that was logged
  LinkedList<URLSessionState> sessions_;  // that have requests or connections
  RequestLines lines_;
  RouteWatch routes_;
  ConnectionPools pools_;
  WaitingRequests waiting_;
  RequestEnds ends_;
  Deadline quiet_;  // since no session had requests or connections any more
};

}  // namespace kyt
