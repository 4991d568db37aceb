// What the handle of a URL session and the network thread share about it. Small: there is one for each
// reporting session, and most of them are idle. Freed when the handle, its requests and their completions are
// gone.
#pragma once

#include <atomic>
#include <map>
#include <memory>
#include <vector>

#include "platform/URLSession.h"
#include "platform/base/OutstandingBytes.h"
#include "platform/linux/url/LinkedList.h"
#include "platform/linux/url/URLConnectionPool.h"
#include "platform/linux/url/URLTransfer.h"
#include "platform/linux/url/WaitingRequests.h"
#include "platform/queues/SerialQueue.h"

namespace kyt {

class URLNetwork;

struct URLSessionState {
  URLSessionState(std::shared_ptr<URLNetwork> owner, URLSessionConfiguration wanted)
      : network(std::move(owner)), configuration(std::move(wanted)) {}

  // Constant. The network outlives every session's last request.
  const std::shared_ptr<URLNetwork> network;
  const URLSessionConfiguration configuration;

  // Self-synchronised.
  std::atomic<bool> used{false};  // a request was started: the network thread knows this session
  std::atomic<bool> invalidated{false};
  OutstandingBytes outstanding;

  // The network thread's.
  std::shared_ptr<URLSessionState> self;  // while listed: connections end on the network thread alone
  Links<URLSessionState> links;           // among the sessions that have requests or connections
  LinkedList<URLTransfer> transfers;      // not yet completed, in the order in which they were started
  std::map<const OutstandingBytes::User*, WaitingLine> waiting;  // those of them that wait, by user
  std::vector<std::shared_ptr<SerialQueue>> queues;              // run completions, one for each user
  // Connections that may use cellular interfaces, and those that may not: never shared.
  std::unique_ptr<URLConnectionPool> pools[2];
};
static_assert(sizeof(URLSessionState) < 300);

}  // namespace kyt
