#include "platform/linux/url/RequestLines.h"

#include <utility>

#include "platform/base/Limits.h"
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

bool RequestLines::Server::hasRoomFor(uint64_t owner) const {
  const auto user = users.find(owner);
  return user == users.end() || user->second.requests < Limits::activeRequestsOfUserToOneServer ||
         user->second.bytes < Limits::smallRequestBytesOfUserToOneServer;
}

bool RequestLines::mayGo(URLTransfer& transfer) {
  Server& server = serverOf(transfer)->second;
  // One with an end of its own (a storebag's) has no time to wait, and there are few of them.
  if (!transfer.request.timeout && (inLine_ > 0 || active_ >= most_ || server.active >= mostToOneServer_ ||
                                    !server.hasRoomFor(transfer.owner()))) {
    server.line.push(transfer.self);
    ++inLine_;
    return false;
  }
  count(transfer, server);
  return true;
}

void RequestLines::count(URLTransfer& transfer, Server& server) {
  ++active_;
  ++server.active;
  OnTheWay& user = server.users[transfer.owner()];
  transfer.countedBytes = transfer.request.body.size();
  ++user.requests;
  user.bytes += transfer.countedBytes;
}

void RequestLines::goesAgain(URLTransfer& transfer) {
  count(transfer, serverOf(transfer)->second);
}

void RequestLines::hasGone(const URLTransfer& transfer) {
  const auto found = servers_.find(serverName(transfer));
  --active_;
  --found->second.active;
  const auto user = found->second.users.find(transfer.owner());
  user->second.bytes -= transfer.countedBytes;
  if (--user->second.requests == 0) found->second.users.erase(user);
  forgetIfUnused(found);
}

std::shared_ptr<URLTransfer> RequestLines::next() {
  while (inLine_ > 0 && active_ < most_) {
    const auto found = nextServer();
    if (found == servers_.end()) return nullptr;
    Server& server = found->second;
    std::shared_ptr<URLTransfer> transfer =
        server.line.pop([&server](uint64_t owner) { return server.hasRoomFor(owner); });
    --inLine_;
    if (transfer->phase == URLTransfer::Phase::inLine) {
      server.lastTurn = ++turns_;
      count(*transfer, server);
      return transfer;
    }
    forgetIfUnused(found);
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
    if (one.active >= mostToOneServer_) continue;
    if (!one.line.has([&one](uint64_t owner) { return one.hasRoomFor(owner); })) continue;
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
