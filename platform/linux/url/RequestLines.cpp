#include "platform/linux/url/RequestLines.h"

#include <utility>

#include "platform/linux/url/URLTransfer.h"

namespace kyt {

namespace {

// The address up to its path. Two spellings of one server count as two.
std::string_view serverName(const URLTransfer& transfer) {
  const std::string_view url = transfer.request.url;
  const size_t scheme = url.find("://");
  if (scheme == url.npos) return url;
  return url.substr(0, url.find_first_of("/?#", scheme + 3));
}

}  // namespace

bool RequestLines::mayGo(URLTransfer& transfer) {
  Server& server = serverOf(transfer)->second;
  // One with an end of its own (a storebag's) has no time to wait, and there are few of them.
  if (!transfer.request.timeout && (inLine_ > 0 || active_ >= most_ || server.active >= mostToOneServer_)) {
    server.line.push(transfer.self);
    ++inLine_;
    return false;
  }
  ++active_;
  ++server.active;
  return true;
}

void RequestLines::goesAgain(const URLTransfer& transfer) {
  ++active_;
  ++serverOf(transfer)->second.active;
}

void RequestLines::hasGone(const URLTransfer& transfer) {
  const auto found = servers_.find(serverName(transfer));
  --active_;
  --found->second.active;
  forgetIfUnused(found);
}

std::shared_ptr<URLTransfer> RequestLines::next() {
  while (inLine_ > 0 && active_ < most_) {
    const auto server = nextServer();
    if (server == servers_.end()) return nullptr;
    std::shared_ptr<URLTransfer> transfer = server->second.line.pop();
    --inLine_;
    if (transfer->phase == URLTransfer::Phase::inLine) {
      server->second.lastTurn = ++turns_;
      ++active_;
      ++server->second.active;
      return transfer;
    }
    forgetIfUnused(server);
  }
  return nullptr;
}

RequestLines::Servers::iterator RequestLines::serverOf(const URLTransfer& transfer) {
  const std::string_view name = serverName(transfer);
  const auto found = servers_.find(name);
  return found != servers_.end() ? found : servers_.emplace(std::string(name), Server()).first;
}

RequestLines::Servers::iterator RequestLines::nextServer() {
  auto best = servers_.end();
  for (auto server = servers_.begin(); server != servers_.end(); ++server) {
    const Server& one = server->second;
    if (one.line.empty() || one.active >= mostToOneServer_) continue;
    if (best == servers_.end() ||
        std::pair(one.active, one.lastTurn) < std::pair(best->second.active, best->second.lastTurn))
      best = server;
  }
  return best;
}

void RequestLines::forgetIfUnused(Servers::iterator server) {
  if (server->second.active == 0 && server->second.line.empty()) servers_.erase(server);
}

}  // namespace kyt
