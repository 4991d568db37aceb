// The connections of one session to its servers: a libcurl multi handle with its cache of connections, run by
// the network thread's event loop. Made at a session's first request, freed when idle. Network thread only.
#pragma once

#include <curl/curl.h>

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/linux/url/ConnectionGrowth.h"
#include "platform/linux/url/CurlLibrary.h"
#include "platform/linux/url/DeadlineHeap.h"
#include "platform/linux/url/LinkedList.h"
#include "platform/linux/url/URLConnection.h"

namespace kyt {

class URLRequests;
class URLTransfer;
struct NetworkTools;
struct URLSessionState;

class URLConnectionPool {
 public:
  URLConnectionPool(URLRequests& requests, NetworkTools& tools, URLSessionState& session, size_t number);
  ~URLConnectionPool();  // precondition: no transfer is in it
  URLConnectionPool(const URLConnectionPool&) = delete;
  URLConnectionPool& operator=(const URLConnectionPool&) = delete;

  [[nodiscard]] CURLcode add(URLTransfer& transfer);
  void remove(URLTransfer& transfer);  // whether it has ended or not
  void socketReady(int socket, uint32_t events);
  // A socket for a connection of this pool to `peer`; `interface`: that it is bound to.
  void opened(int socket, std::string interface, const sockaddr_storage& peer);
  // The one between these addresses, or null.
  [[nodiscard]] std::shared_ptr<URLConnection> connectionBetween(const char* local, int localPort,
                                                                 const char* peer, int peerPort);
  // Looks where its connections lead. Whether a new request may go on any of them: none would leave otherwise when
  // it were made now. `routes`: the number of their last change.
  [[nodiscard]] bool judgeConnections(uint64_t routes);
  // No new request: it ends with its last one. Its owner is the network from then on, which takes those out of it
  // that have not begun.
  void retire();
  bool isSearched = false;  // for those
  [[nodiscard]] URLSessionState& session() { return session_; }
  [[nodiscard]] bool isEmpty() const { return active_ == 0; }
  [[nodiscard]] size_t connections() const { return connections_.size(); }
  uint64_t routesWhenJudged = 0;  // the number of their last change
  // Frees itself from the event loop when nothing is in it: after a while, or soon when its session has ended and has no
  // request but `leaving` left, which may be null.
  void closeIfIdle(const URLTransfer* leaving = nullptr);
  // It goes on a connection of this pool.
  void hasBegun(URLTransfer& transfer);
  // Among the idle ones that are kept.
  Links<URLConnectionPool> links;
  size_t keptConnections = 0;  // while it is one of them

 private:
  void leaveIdle();
  void lookAgain(URLTransfer& transfer);
  [[nodiscard]] bool isConnecting() const;
  [[nodiscard]] std::shared_ptr<CURLSH> ticketsFor(const URLTransfer& transfer);
  static int socketClosed(void* pool, curl_socket_t socket);
  static int socketChanged(CURL* handle, curl_socket_t socket, int what, void* pool, void*);
  static int timerChanged(CURLM* multi, long milliseconds, void* pool);
  [[nodiscard]] CURL* takeHandle();
  [[nodiscard]] bool mayResume(const URLTransfer& transfer);
  void timerExpired();
  void closeWhenIdle();
  void finishEnded();

  URLRequests& requests_;
  NetworkTools& tools_;
  URLSessionState& session_;
  const size_t number_;  // in the session
  const CurlLibrary& curl_;
  CURLM* multi_;
  size_t active_ = 0;
  bool isRetired_ = false;
  std::vector<std::shared_ptr<URLConnection>> connections_;  // some of them never come to be
  std::optional<unsigned> certificates_;  // their generation when a server was verified first
  std::shared_ptr<CURLSH> tickets_;       // of requests without an identity
  std::vector<CURL*> idleHandles_;
  ConnectionGrowth growth_;
  Deadline timer_;  // libcurl's
  Deadline idle_;
};

}  // namespace kyt
