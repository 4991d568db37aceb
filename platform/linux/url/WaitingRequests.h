// The requests that wait for connectivity: what they count towards their users' limits, which of them give way when too
// much of one user's waits, and which are tried again. Network thread only.
#pragma once

#include <cstddef>

#include "platform/base/Function.h"
#include "platform/linux/url/LinkedList.h"
#include "platform/linux/url/NetworkTools.h"
#include "platform/linux/url/URLTransfer.h"

namespace kyt {

struct URLSessionState;

// One user's in one session, oldest first, and what they count towards the limit.
struct WaitingLine {
  struct WaitingLinks {
    static Links<URLTransfer>& of(URLTransfer& transfer) { return transfer.waitingLinks; }
  };
  LinkedList<URLTransfer, WaitingLinks> transfers;
  size_t bytes = 0;
};

class WaitingRequests {
 public:
  // The first two have to remove() the request, which may end with it, and the third to leave it alone.
  struct Callbacks {
    Function<void(URLTransfer&)> displaced;
    Function<void(URLTransfer&)> goAgain;
    Function<bool(const URLTransfer&)> canLeave;
  };
  WaitingRequests(NetworkTools& tools, Callbacks callbacks)
      : tools_(tools), callbacks_(std::move(callbacks)) {}

  // Displaces its user's oldest requests of that session, itself at last, while they count too much.
  void add(URLTransfer& transfer);
  void remove(URLTransfer& transfer);
  // Lets those go again that could leave. What is asked about the same servers is asked once: thousands of sessions may
  // wait for one. `evenIfNamesSeemUnknowable`: and those whose server's address is not known.
  void retry(const LinkedList<URLSessionState>& sessions, bool evenIfNamesSeemUnknowable);
  [[nodiscard]] bool empty() const { return count_ == 0; }

 private:
  class Answers;
  NetworkTools& tools_;
  Callbacks callbacks_;
  size_t count_ = 0;
};

}  // namespace kyt
