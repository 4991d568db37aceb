// The TLS sessions that servers let be taken up again, so that a new connection costs them and us less than half. Whoever
// shows a server its ticket is known to be the one who got it. So tickets are shared, among all URL sessions, by requests
// of one identity alone: what the server can tell from them anyway (URLRequest::identity).
//
// They are forgotten when routes or addresses have changed, since in TLS 1.2 whoever watches the network sees them, and
// could follow the device from one network to the next; when the trusted certificates have, since a session that is taken up
// again is not verified again; and after an hour. Network thread only.
#pragma once

#include <curl/curl.h>

#include <cstddef>
#include <cstdint>
#include <list>
#include <memory>
#include <string>

#include "platform/base/Clock.h"
#include "platform/linux/url/CurlLibrary.h"

namespace kyt {

class TLSTickets {
 public:
  static constexpr size_t kMostIdentities = 64;  // some 5 KiB each; the one used longest ago goes
  static constexpr Duration kLifetime = std::chrono::hours(1);

  // For libcurl's handles (CURLOPT_SHARE); kept while one has it. Null when there is no memory.
  using Shared = std::shared_ptr<CURLSH>;
  // Nobody else's.
  [[nodiscard]] static Shared make(const CurlLibrary& curl);
  // Those of that identity. `certificates`, `routes`: numbers that change when what the tickets rest on has.
  [[nodiscard]] Shared of(const CurlLibrary& curl, const std::string& identity, unsigned certificates,
                          uint64_t routes, MonotonicTime now);
  void forget() { known_.clear(); }
  [[nodiscard]] size_t identities() const { return known_.size(); }

 private:
  struct Known {
    std::string identity;
    Shared tickets;
    MonotonicTime since;
  };
  std::list<Known> known_;  // the one used last is first
  unsigned certificates_ = 0;
  uint64_t routes_ = 0;
};

}  // namespace kyt
