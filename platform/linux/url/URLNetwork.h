// The network thread ("kyt-network") and everything it runs: the event loop over the sockets of all
// connection pools, time-outs, requests that wait for connectivity, and the hand-over of results to the
// sessions' delegate queues.
//
// Other threads submit commands, with a short lock and one wake-up for each burst. The thread is started by
// the first command and ended by stop(). Held by the factory and by every session, so that a session may
// outlive the factory.
#pragma once

#include <atomic>
#include <memory>
#include <thread>
#include <vector>

#include "platform/base/ConditionVariable.h"
#include "platform/base/Counters.h"
#include "platform/base/Mutex.h"
#include "platform/linux/url/CertificateStore.h"
#include "platform/linux/url/CurlLibrary.h"
#include "platform/linux/url/CurlURLSession.h"
#include "platform/linux/url/DeadlineHeap.h"
#include "platform/linux/url/RequestLines.h"
#include "platform/linux/url/RouteEvents.h"
#include "platform/linux/url/RouteTable.h"
#include "platform/linux/url/URLSessionState.h"
#include "platform/linux/url/WatchedSockets.h"
#include "platform/queues/Log.h"
#include "platform/queues/WorkerPool.h"

namespace kyt {

// The pools that are idle, longest first; the number of those kept has a limit.
class IdlePools {
 public:
  explicit IdlePools(size_t most) : most_(most) {}
  // The pool that had to leave to keep the limit, or null.
  [[nodiscard]] URLConnectionPool* add(URLConnectionPool& pool) {
    pools_.append(pool);
    pool.isKept = true;
    if (++count_ <= most_) return nullptr;
    URLConnectionPool* surplus = pools_.first();
    remove(*surplus);
    return surplus;
  }
  void remove(URLConnectionPool& pool) {
    if (!std::exchange(pool.isKept, false)) return;
    pools_.remove(pool);
    --count_;
  }

 private:
  const size_t most_;
  size_t count_ = 0;
  LinkedList<URLConnectionPool> pools_;
};

class URLNetwork {
 public:
  URLNetwork(CurlURLSessionOptions options, Log& log, Counters& counters);
  ~URLNetwork();
  URLNetwork(const URLNetwork&) = delete;
  URLNetwork& operator=(const URLNetwork&) = delete;

  // Any thread.
  void start(std::shared_ptr<URLTransfer> transfer);
  void cancel(std::shared_ptr<URLTransfer> transfer);
  void invalidate(std::shared_ptr<URLSessionState> session);
  void cancelAwaited();
  void cancelAll();
  // Cancels what is left, and ends the threads; false when completions still run after `patience`. Once, not from a
  // thread of this network.
  [[nodiscard]] bool stopWithin(Duration patience);
  void stop();  // the same, however long it takes, also after the other
  void completionHasRun();
  [[nodiscard]] URLFigures figures() const;
  [[nodiscard]] size_t outstanding() const { return outstanding_.load(); }

  // The network thread's, for pools and transfers.
  void countReplyWithoutRoom();
  [[nodiscard]] MonotonicTime now() const { return now_; }
  [[nodiscard]] DeadlineHeap& deadlines() { return deadlines_; }
  [[nodiscard]] IdlePools& idlePools() { return idlePools_; }
  [[nodiscard]] RouteTable& routes() { return routes_; }
  [[nodiscard]] const CurlLibrary& curl() const { return *curl_; }  // loaded, once there is a pool
  [[nodiscard]] CertificateStore& certificates() { return certificates_; }
  [[nodiscard]] const CurlURLSessionOptions& options() const { return options_; }
  [[nodiscard]] WatchedSockets& sockets() { return sockets_; }
  // How often routes and addresses have changed, as far as it is known.
  [[nodiscard]] uint64_t routeChanges() const { return routeChanges_; }
  void connectionLost(URLTransfer& transfer);  // no way leads from its connection to the server
  void transferEnded(URLTransfer& transfer, CURLcode code);
  void transferDeadline(URLTransfer& transfer);
  void closePool(URLSessionState& session, size_t number);

 private:
  enum class Kind : uint8_t { start, cancel, invalidate };
  struct Command {
    Kind kind;
    std::shared_ptr<URLTransfer> transfer;
    std::shared_ptr<URLSessionState> session;
  };

  enum class Which : uint8_t { all, awaited };

  void submit(Command command);
  void insistOnTheThread();
  void wakeUp();
  [[nodiscard]] bool startThread() REQUIRES(mutex_);
  void run();
  [[nodiscard]] int waitingTime() const;
  void handleEvent(uint64_t which, uint32_t events);
  void takeCommands();
  void begin(std::shared_ptr<URLTransfer> transfer);
  [[nodiscard]] bool loadCurl();
  void refuse(URLTransfer& transfer);
  void activate(URLTransfer& transfer);  // or puts it in line
  void activateNextInLine();
  void armDeadline(URLTransfer& transfer);
  void withdraw(URLTransfer& transfer);  // from its pool, or from the waiting ones
  void finish(URLTransfer& transfer);    // its result is set
  void fail(URLTransfer& transfer, int32_t code, std::string description);
  void unlistIfUnused(URLSessionState& session);
  void cancelWhatIsUnwanted();
  void cancelRequests(Which which);

  // Connections, and how requests on them end (URLNetworkConnections.cpp).
  [[nodiscard]] URLConnectionPool& poolFor(URLTransfer& transfer);
  void failWith(URLTransfer& transfer, CURLcode code);
  [[nodiscard]] bool goAgainOrWait(URLTransfer& transfer);
  void ended(URLTransfer& transfer, CURLcode code, long systemError);
  void endOthersThatMay(const URLConnection& connection);
  void stuck(URLTransfer& transfer);
  void lookAtLostConnection(URLTransfer& transfer);
  void noteRouteChanges();
  void judgeConnections();
  void retire(std::unique_ptr<URLConnectionPool>& pool);
  void retirePoolOf(const URLTransfer& transfer);
  void emptyRetiredPools();
  void endRetiredPools();

  // Waiting for connectivity (URLNetworkWaiting.cpp).
  class Answers;
  [[nodiscard]] bool retryOrWait(URLTransfer& transfer, CURLcode code, long systemError);
  [[nodiscard]] bool canLeave(const URLTransfer& transfer);
  void setAside(URLTransfer& transfer);
  void displace(URLTransfer& oldest);
  void stopWaiting(URLTransfer& transfer);
  void listenForRoutes();
  void routesChanged();
  void retryWaiting(bool evenIfNamesSeemUnknowable);
  void waitingTimer();

  // Constant.
  const CurlURLSessionOptions options_;
  Log& log_;
  Counters& counters_;

  // Self-synchronised.
  std::atomic<size_t> outstanding_{0};
  std::atomic<bool> cancelled_{false}, awaitedCancelled_{false};
  std::atomic<uint64_t> started_{0}, completed_{0}, failed_{0}, waiting_{0}, waitingBodyBytes_{0},
      displaced_{0}, refused_{0};
  int epoll_ = -1, wake_ = -1;

  Mutex mutex_;
  std::vector<Command> commands_ GUARDED_BY(mutex_);
  bool running_ GUARDED_BY(mutex_) = false;
  bool stopping_ GUARDED_BY(mutex_) = false;
  bool threadEnds_ GUARDED_BY(mutex_) = false;  // nothing is left for it to do
  std::thread thread_ GUARDED_BY(mutex_);
  ConditionVariable changed_;  // the thread ends, or nothing is outstanding any more

  // The network thread's.
  MonotonicTime now_;
  DeadlineHeap deadlines_;
  IdlePools idlePools_;
  RouteTable routes_;
  RouteEvents routeEvents_;
  bool isDeaf_ = false;  // there could be no subscription: nobody told of the last changes
  uint64_t routeChanges_ = 0;
  CertificateStore certificates_;
  std::optional<CurlLibrary> curl_;
  std::string curlProblem_;  // the last one that was logged
  WatchedSockets sockets_;
  std::vector<Command> taken_;
  bool awaitedGone_ = false;  // those there were when they were cancelled; later ones are refused
  RequestLines lines_;
  LinkedList<URLSessionState> sessions_;  // that have requests or connections
  std::vector<std::unique_ptr<URLConnectionPool>> retired_;
  Deadline settle_;  // route events come in bursts: what waits is tried a moment after the first
  Deadline slowRetry_;
  Deadline rest_;   // of sockets that can be written to in vain
  Deadline quiet_;  // since no session had requests or connections any more

  std::unique_ptr<WorkerPool> workers_;  // made by the network thread, shut down by stop()
};

}  // namespace kyt
