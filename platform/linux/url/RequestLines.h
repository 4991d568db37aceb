// Which requests may be on their way: so many in all, and so many to one server, so that one that does not answer (each
// request to it lasts a minute) leaves room for those to others. What may not go yet waits in its server's line; the
// server with the fewest requests on their way comes first. Belongs to the network thread.
#pragma once

#include <cstddef>
#include <deque>
#include <map>
#include <memory>
#include <string>
#include <string_view>

namespace kyt {

class URLTransfer;

class RequestLines {
 public:
  RequestLines(size_t most, size_t mostToOneServer) : most_(most), mostToOneServer_(mostToOneServer) {}

  // Counts it and answers true, or puts it in line. One that cannot wait is always counted.
  [[nodiscard]] bool mayGo(URLTransfer& transfer);
  // One that was counted goes no more.
  void hasGone(const URLTransfer& transfer);
  // The next that may go, taken out of its line and not counted, or null.
  [[nodiscard]] std::shared_ptr<URLTransfer> next();

 private:
  struct Server {
    size_t active = 0;
    std::deque<std::shared_ptr<URLTransfer>>
        line;  // those among them that are in line no more are passed over
  };
  using Servers = std::map<std::string, Server, std::less<>>;
  void forgetIfUnused(Servers::iterator server);

  const size_t most_, mostToOneServer_;
  size_t active_ = 0;
  size_t inLine_ = 0;
  Servers servers_;  // that have any
};

}  // namespace kyt
