// The connections of one session to its servers: a libcurl multi handle with its cache of connections, run by
// the network thread's event loop. Made at a session's first request, freed when idle. Network thread only.
#pragma once

#include <curl/curl.h>

#include <cstddef>
#include <cstdint>
#include <vector>

#include "platform/linux/url/CurlLibrary.h"
#include "platform/linux/url/DeadlineHeap.h"
#include "platform/linux/url/LinkedList.h"

namespace kyt {

class URLNetwork;
class URLTransfer;
struct URLSessionState;

class URLConnectionPool {
 public:
  URLConnectionPool(URLNetwork& network, URLSessionState& session, size_t number);
  ~URLConnectionPool();  // precondition: no transfer is in it
  URLConnectionPool(const URLConnectionPool&) = delete;
  URLConnectionPool& operator=(const URLConnectionPool&) = delete;

  [[nodiscard]] CURLcode add(URLTransfer& transfer);
  void remove(URLTransfer& transfer);  // whether it has ended or not
  void socketReady(int socket, uint32_t events);
  // Frees itself from the event loop, soon, when nothing is in it.
  void closeIfIdle();
  // Among the idle ones that are kept.
  Links<URLConnectionPool> links;
  bool isKept = false;

 private:
  void leaveIdle();
  static int socketChanged(CURL* handle, curl_socket_t socket, int what, void* pool, void*);
  static int timerChanged(CURLM* multi, long milliseconds, void* pool);
  [[nodiscard]] CURL* takeHandle();
  void timerExpired();
  void finishEnded();

  URLNetwork& network_;
  URLSessionState& session_;
  const size_t number_;  // in the session
  const CurlLibrary& curl_;
  CURLM* multi_;
  size_t active_ = 0;
  std::vector<CURL*> idleHandles_;
  Deadline timer_;  // libcurl's
  Deadline idle_;
};

}  // namespace kyt
