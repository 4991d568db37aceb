// The URL session port on libcurl: one network thread for all sessions, started at first use, and a
// connection pool for each session, which exists from its first request until it has been idle for a while.
// Made and owned by the composition root; see platform/URLSession.h for the contract.
//
// Connections verify their server always (TLS 1.2 or newer), negotiate HTTP/2 over TLS, use no proxy, and are
// kept alive for the session's next request. A session has one connection to each server; as long as requests wait too
// long for those there are, their number doubles, up to eight. TLS sessions are taken up again by requests of the same
// identity (TLSTickets.h). Completions run on serial queues, one for each user in each session, on worker threads of
// their own ("kyt-url").
//
// A request is sent once: libcurl would send it again, up to five times, when a kept connection ends under it, and no
// option forbids that. It goes again only where the server's TCP has acknowledged not a byte of it (URLConnection.h), on
// a new connection and three times at most; GET and HEAD, which change nothing, go again as libcurl likes. A kept
// connection is looked at before it is used: whether its server has ended it, and, when the kernel has announced a
// change of routes or addresses or cannot tell, whether a new one would leave the same way. Where none of them would, what
// has not begun starts anew. Over HTTP/2 a request that has ended unheard goes again only when its connection owes no
// answer to others, since that is broken off before.
//
// In sessions that wait for connectivity a request without a route, or whose server's name cannot be looked
// up because no name server has a route, is set aside until the kernel announces a change (or, as a second
// net, a slow timer passes), and then tried again. Other failures, a refused connection for one, are the
// caller's. Where an unknown name meets a network without default route the two cannot be told apart, and the
// request waits.
//
// A request that may not use cellular interfaces has its socket bound to the other interface that its route
// takes, so that no later change of routes moves it, and shares no connection with requests that may.
// Look-ups of names are the system resolver's and go where it sends them.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "platform/URLSession.h"
#include "platform/base/Clock.h"
#include "platform/base/Limits.h"

namespace kyt {

class Counters;
class Log;
class ServerRecords;
class URLNetwork;

struct CurlURLSessionOptions {
  std::string library = "libcurl.so.4";                     // loaded at the first request
  std::string certificateFile;                              // PEM; empty: the system's
  std::vector<std::string> cellularInterfaces = {"wwan*"};  // shell patterns, besides what the kernel marks
  Duration noProgressTimeout = std::chrono::seconds(60);
  Duration requestTime = std::chrono::duration_cast<Duration>(
      std::chrono::duration<double>(Limits::requestSeconds));  // and what its body takes
  Duration idleConnectionTime = std::chrono::seconds(30);      // then a session's connections close
  // How long a request waits for a connection in use before another one is made; longer, up to a second, where making one
  // has taken longer.
  Duration connectionPatience = std::chrono::milliseconds(100);
  size_t maxIdleConnections = 1024;  // of all sessions: descriptors
  size_t maxActiveRequests = Limits::maxActiveRequests;
  size_t maxActiveRequestsToOneServer = Limits::maxActiveRequestsToOneServer;
  Duration waitingRetryPeriod = std::chrono::seconds(30);  // the second net under the kernel's events
  std::string sysClassNet = "/sys/class/net";
  std::string resolverFile = "/etc/resolv.conf";
  // Called when there was nothing to do for so long: by the last thread of completions when it ends, and by the network
  // thread when no connection is left. No lock held.
  Duration quietTime = std::chrono::seconds(10);
  void (*whenQuiet)() = nullptr;
  ServerRecords* servers = nullptr;  // is told how each request ended; null: nobody. It outlives the network
};

class CurlURLSessionFactory final : public URLSessionFactory {
 public:
  CurlURLSessionFactory(CurlURLSessionOptions options, Log& log, Counters& counters);
  // Whom requests trust, and which interfaces count as cellular.
  struct Access {
    std::string certificateFile;
    std::vector<std::string> cellularInterfaces;
  };
  // In place of what the options said: for requests that begin later, and connections made later. Any thread.
  void reconfigure(Access access);
  // Cancels what is left, waits for the completions that run or are due (at most five seconds), ends the
  // threads. Sessions may outlive it and then start nothing. Not from a completion.
  ~CurlURLSessionFactory() override;

  // The same before the end, for an owner whose completions use what is destroyed earlier than this. False when they
  // still run after `patience`. Once, not from a completion; nothing starts afterwards.
  [[nodiscard]] bool shutDownWithin(Duration patience);

  [[nodiscard]] std::unique_ptr<URLSession> create(URLSessionConfiguration configuration) override;
  void cancelAwaited() override;
  void cancelAll() override;
  [[nodiscard]] URLFigures figures() const override;
  [[nodiscard]] size_t outstanding() const override;
  void watchConnectivity(std::shared_ptr<Function<void()>> changed) override;

 private:
  std::shared_ptr<URLNetwork> network_;
};

}  // namespace kyt
