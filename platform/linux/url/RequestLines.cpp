#include "platform/linux/url/RequestLines.h"

#include <utility>

#include "platform/linux/url/URLTransfer.h"

namespace kyt {

namespace {

// The address up to its path. Two spellings of one server count as two.
std::string_view serverOf(const URLTransfer& transfer) {
  const std::string_view url = transfer.request.url;
  const size_t scheme = url.find("://");
  if (scheme == url.npos) return url;
  return url.substr(0, url.find_first_of("/?#", scheme + 3));
}

}  // namespace

bool RequestLines::mayGo(URLTransfer& transfer) {
  const std::string_view name = serverOf(transfer);
  auto found = servers_.find(name);
  if (found == servers_.end()) found = servers_.emplace(std::string(name), Server()).first;
  Server& server = found->second;
  // One with an end of its own (a storebag's) has no time to wait, and there are few of them.
  if (!transfer.request.timeout && (active_ >= most_ || server.active >= mostToOneServer_)) {
    server.line.push_back(transfer.self);
    ++inLine_;
    return false;
  }
  ++active_;
  ++server.active;
  return true;
}

void RequestLines::hasGone(const URLTransfer& transfer) {
  const auto found = servers_.find(serverOf(transfer));
  --active_;
  --found->second.active;
  forgetIfUnused(found);
}

std::shared_ptr<URLTransfer> RequestLines::next() {
  while (inLine_ > 0 && active_ < most_) {
    auto best = servers_.end();
    for (auto server = servers_.begin(); server != servers_.end(); ++server) {
      if (server->second.line.empty() || server->second.active >= mostToOneServer_) continue;
      if (best == servers_.end() || server->second.active < best->second.active) best = server;
    }
    if (best == servers_.end()) return nullptr;
    std::shared_ptr<URLTransfer> transfer = std::move(best->second.line.front());
    best->second.line.pop_front();
    --inLine_;
    forgetIfUnused(best);
    if (transfer->phase == URLTransfer::Phase::inLine) return transfer;
  }
  return nullptr;
}

void RequestLines::forgetIfUnused(Servers::iterator server) {
  if (server->second.active == 0 && server->second.line.empty()) servers_.erase(server);
}

}  // namespace kyt
