// What becomes of a request when an attempt of it ends, or its time is over: its reply, another attempt, waiting for
// connectivity, or a failure. A request goes again only where the server's TCP has acknowledged not a byte of it. Network
// thread only.
#pragma once

#include <curl/curl.h>

#include "platform/linux/url/NetworkTools.h"

namespace kyt {

class ConnectionPools;
class RouteWatch;
class URLConnection;
class URLRequests;
class URLTransfer;

class RequestEnds {
 public:
  RequestEnds(URLRequests& requests, NetworkTools& tools, ConnectionPools& pools, RouteWatch& routes)
      : requests_(requests), tools_(tools), pools_(pools), routes_(routes) {}

  void attemptEnded(URLTransfer& transfer, CURLcode code);  // says libcurl
  void deadlinePassed(URLTransfer& transfer);
  void connectionLost(URLTransfer& transfer);  // no way leads from its connection to the server

 private:
  void endedWithout(URLTransfer& transfer, CURLcode code, long systemError);
  void endOthersThatMay(const URLConnection& connection);
  void failWith(URLTransfer& transfer, CURLcode code);
  [[nodiscard]] bool goAgainOrWait(URLTransfer& transfer);
  [[nodiscard]] bool retryOrWait(URLTransfer& transfer, CURLcode code, long systemError);
  void stuck(URLTransfer& transfer);
  void lookAtLostConnection(URLTransfer& transfer);

  URLRequests& requests_;
  NetworkTools& tools_;
  ConnectionPools& pools_;
  RouteWatch& routes_;
};

}  // namespace kyt
