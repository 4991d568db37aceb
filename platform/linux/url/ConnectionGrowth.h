// Decides how many connections a pool may have to one server. It begins with one: most answers come sooner than a further
// connection would be there, and with TLS that costs as much as many requests. Where the oldest request that has not
// begun waits too long all the same, since others are not answered, the number doubles, up to eight. It does not while it
// is the network thread that is busy. Connections that carry many requests at once (HTTP/2) need no such care, and those
// without TLS are cheaper than a wait. Network thread only.
#pragma once

#include "platform/base/Function.h"
#include "platform/linux/url/DeadlineHeap.h"
#include "platform/linux/url/LinkedList.h"
#include "platform/linux/url/NetworkTools.h"
#include "platform/linux/url/URLTransfer.h"

namespace kyt {

class ConnectionGrowth {
 public:
  static constexpr long kMost = 8;

  struct Callbacks {
    Function<void(long most)> allow;         // so many to one server
    Function<void(URLTransfer&)> lookAgain;  // it may find that one more is allowed; it may end with it
    Function<bool()> isConnecting;           // whether a connection will soon be there
  };
  ConnectionGrowth(NetworkTools& tools, Callbacks callbacks);

  void wait(URLTransfer& transfer);   // it has no connection, or none any more
  void leave(URLTransfer& transfer);  // it has, or has left the pool; also when it did not wait
  void connected(Duration took);      // another connection is there
  void noMatter();                    // from now on as many as may ever be, soon
  void noMatterNow();                 // the same at once; not while libcurl is calling
  void reset();                       // nothing is in the pool

 private:
  struct UnbegunLinks {
    static Links<URLTransfer>& of(URLTransfer& transfer) { return transfer.unbegunLinks; }
  };
  [[nodiscard]] MonotonicTime due() const;
  [[nodiscard]] Duration patience() const;
  [[nodiscard]] bool isThreadBusy() const;
  void watch();
  void patienceOver();

  NetworkTools& tools_;
  Callbacks callbacks_;
  LinkedList<URLTransfer, UnbegunLinks> unbegun_;  // oldest first
  long most_ = 1;
  bool matters_ = true;
  Duration restedBefore_{};   // of the network thread, when the wait began that is looked at next
  MonotonicTime lastChange_;  // when a connection was there, or more were allowed
  Duration toConnect_{};      // how long it took to make the last one
  Deadline patience_;
};

}  // namespace kyt
