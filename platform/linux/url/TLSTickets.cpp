#include "platform/linux/url/TLSTickets.h"

#include <algorithm>

namespace kyt {

TLSTickets::Shared TLSTickets::make(const CurlLibrary& curl) {
  // One thread has them all, so no locks are set.
  Shared made(curl.shareInit(), [cleanup = curl.shareCleanup](CURLSH* share) {
    if (share != nullptr) cleanup(share);
  });
  if (made) curl.shareSetOption(made.get(), CURLSHOPT_SHARE, CURL_LOCK_DATA_SSL_SESSION);
  return made;
}

TLSTickets::Shared TLSTickets::of(const CurlLibrary& curl, const std::string& identity, unsigned certificates,
                                  uint64_t routes, MonotonicTime now) {
  if (certificates != certificates_ || routes != routes_) forget();
  certificates_ = certificates;
  routes_ = routes;
  auto found = std::find_if(known_.begin(), known_.end(),
                            [&](const Known& known) { return known.identity == identity; });
  if (found != known_.end() && now >= found->since + kLifetime) {
    known_.erase(found);
    found = known_.end();
  }
  if (found != known_.end()) {
    known_.splice(known_.begin(), known_, found);
    return found->tickets;
  }
  Shared made = make(curl);
  if (!made) return nullptr;
  if (known_.size() >= kMostIdentities) known_.pop_back();
  known_.push_front({identity, made, now});
  return made;
}

}  // namespace kyt
