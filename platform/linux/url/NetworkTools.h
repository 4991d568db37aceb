// What everything on the network thread works with: its event loop's clock, deadlines and sockets, and what is known of
// routes, certificates and libcurl. One for each URL network. Network thread only, but for what is constant.
#pragma once

#include <optional>

#include "platform/base/Counters.h"
#include "platform/linux/url/CertificateStore.h"
#include "platform/linux/url/CurlLibrary.h"
#include "platform/linux/url/CurlURLSession.h"
#include "platform/linux/url/DeadlineHeap.h"
#include "platform/linux/url/RequestFigures.h"
#include "platform/linux/url/RouteTable.h"
#include "platform/linux/url/TLSTickets.h"
#include "platform/linux/url/WatchedSockets.h"
#include "platform/queues/Log.h"

namespace kyt {

struct NetworkTools {
  NetworkTools(CurlURLSessionOptions wanted, Log& toLog, Counters& toCount)
      : options(std::move(wanted)),
        log(toLog),
        counters(toCount),
        routes(options.cellularInterfaces, options.sysClassNet, options.resolverFile),
        certificates(options.certificateFile) {}

  // Constant.
  const CurlURLSessionOptions options;
  Log& log;
  Counters& counters;

  RequestFigures figures;  // self-synchronised

  MonotonicTime now;  // when the last wait for events ended
  Duration rested{};  // how long the thread has waited for events in all
  DeadlineHeap deadlines;
  WatchedSockets sockets;
  RouteTable routes;
  CertificateStore certificates;
  TLSTickets tickets;
  std::optional<CurlLibrary> curl;  // loaded, once there is a pool
};

}  // namespace kyt
