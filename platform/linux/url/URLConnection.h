// One TCP connection of a pool, as the kernel knows it: what its peer's TCP has acknowledged, whether it has ended, and
// whether it still leads to its server. libcurl tells none of this, and sends a request a second time when a kept
// connection ends under it; whether that may happen is decided here.
//
// A request is known not to have arrived when its peer's TCP has acknowledged not a byte behind what had been written
// before it. With TLS and HTTP/2 the bytes behind that mark may be others' as well (a record, a frame of the protocol):
// then the answer is the cautious one. A reset says nothing of what the peer had taken by then, so it proves nothing,
// unless the peer had ended its side of the connection before.
//
// libcurl closes some sockets that never connected without telling. So a socket belongs to a connection from the moment
// on when libcurl names both its addresses. Network thread only.
#pragma once

#include <sys/socket.h>

#include <cstdint>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/base/Clock.h"
#include "platform/linux/url/RouteTable.h"

namespace kyt {

class URLTransfer;

// How many bytes have been written to a TCP socket, whether they have arrived or not.
[[nodiscard]] std::optional<uint64_t> bytesWritten(int socket);

class URLConnection {
 public:
  // `interface`: that it is bound to; empty: to none. `peer`: that it is to lead to.
  URLConnection(int socket, std::string interface, const sockaddr_storage& peer, MonotonicTime now)
      : opened(now), socket_(socket), interface_(std::move(interface)), peer_(peer) {}

  const MonotonicTime opened;

  [[nodiscard]] int socket() const { return socket_; }
  // Whether it is the one between these addresses; once it was, it stays so until it is closed.
  [[nodiscard]] bool isBetween(const char* local, int localPort, const char* peer, int peerPort);
  [[nodiscard]] bool isConnected() const { return connected_; }
  [[nodiscard]] const sockaddr_storage& peer() const { return peer_; }

  // A place in the stream of what is sent: behind everything that has been written by now.
  struct Mark {
    bool known = false;
    uint64_t written = 0;
  };
  [[nodiscard]] Mark mark() const;
  // Whether the peer's TCP is known to have acknowledged nothing behind it. Also after the connection is closed.
  [[nodiscard]] bool hasAcknowledgedNothingBehind(const Mark& mark);

  // Whether the server has ended it, or has said what must be its end, before a request begins on it.
  [[nodiscard]] bool hasEnded() const;
  // What is still there is thrown away, and libcurl finds an ended connection. Of an idle one.
  void letGo();
  // Nothing that has not arrived will arrive any more. libcurl finds a broken connection.
  void abort();
  // The same when something is still to arrive.
  void abortWhatIsLeft();
  // The last look, before the socket is closed; what has not arrived of a request that may go again is thrown away.
  void closing();
  // How a connection made now would leave; none also when this end's address is gone. Of one that is being made too.
  [[nodiscard]] RouteTable::Way way(RouteTable& routes, bool avoidCellular) const;

  bool isSilent = false;                // known to be HTTP/1.1: its server says nothing without being asked
  bool carriesManyAtOnce = false;       // HTTP/2
  unsigned requests = 0;                // that have begun on it
  std::vector<URLTransfer*> transfers;  // those that have not ended
  std::optional<MonotonicTime> lostSince;  // since when no way leads to the server

 private:
  void look();
  void discard() const;
  [[nodiscard]] bool isStillThere() const;
  int socket_;
  bool connected_ = false;
  bool isOver_ = false;  // closed or broken off by us: what is known stays
  bool proves_ = true;   // the figure is worth something
  bool peerEnded_ = false;
  uint64_t acknowledged_ = 0;
  const std::string interface_;
  sockaddr_storage local_{}, peer_;
};

}  // namespace kyt
