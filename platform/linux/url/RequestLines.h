// Decides which requests may be on their way: a number in all, and a number to each server, so that a silent server, to
// which each request lasts a minute, leaves room for requests to others. Of one user there are a few to a server, more while
// they are small: a slow server works through what it was sent in its own order, which no line here can change, and another
// user's request would come after all of it. A request that may not go yet waits in its
// server's line, where users take turns (OwnerLines.h): thousands of one user's hold up another user's first one by one
// request. The server with the fewest requests on their way comes first, of several the one that has waited longest.
// Belongs to the network thread.
#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <string_view>
#include <unordered_map>

#include "platform/queues/OwnerLines.h"

namespace kyt {

class URLTransfer;

class RequestLines {
 public:
  RequestLines(size_t most, size_t mostToOneServer) : most_(most), mostToOneServer_(mostToOneServer) {}

  // Counts the request and returns true, or puts it in line and returns false: while others stand in line it may be their
  // turn, which next() knows; so that is called soon. A request that has a deadline of its own cannot wait and is always counted.
  [[nodiscard]] bool mayGo(URLTransfer& transfer);
  // Counts one that goes anew, and was counted until a moment ago.
  void goesAgain(URLTransfer& transfer);
  // A counted request has ended.
  void hasGone(const URLTransfer& transfer);
  // Takes the next request that may go out of its line, and counts it; null when there is none.
  [[nodiscard]] std::shared_ptr<URLTransfer> next();

 private:
  struct OnTheWay {
    size_t requests = 0;
    size_t bytes = 0;  // of their bodies
  };
  struct Server {
    // Whether one more of this user's requests may go.
    [[nodiscard]] bool hasRoomFor(uint64_t owner) const;
    size_t active = 0;
    std::unordered_map<uint64_t, OnTheWay> users;  // with requests on their way
    uint64_t lastTurn = 0;                         // number of the last one that left the line
    // Some have ended meanwhile; next() passes over these.
    OwnerLines<URLTransfer> line;
  };
  using Servers = std::map<std::string, Server, std::less<>>;
  void count(URLTransfer& transfer, Server& server);
  [[nodiscard]] Servers::iterator serverOf(const URLTransfer& transfer);
  [[nodiscard]] Servers::iterator nextServer();
  void forgetIfUnused(Servers::iterator server);

  const size_t most_, mostToOneServer_;
  size_t active_ = 0;
  size_t inLine_ = 0;
  uint64_t turns_ = 0;
  Servers servers_;  // with requests on their way or in line
};

}  // namespace kyt
