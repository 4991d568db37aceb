// The daemon as the rows measure it, between clients that cost little and a sink in this process: real sockets in, real
// HTTP out. One thread.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "bench/Peer.h"
#include "bench/Processes.h"
#include "bench/SinkServer.h"
#include "platform/objects/Value.h"
#include "tools/demo/Stage.h"

namespace kyt::bench {

// Calls of SendMessageWithDictionary, ready to be written.
[[nodiscard]] std::vector<std::string> eventCalls(const std::vector<Dictionary>& payloads);

class Stand {
 public:
  struct Options {
    std::string programs, share;
    bool consent = false;
    bool tls = false;           // of the posts
    int batch = 50;             // events of a post
    std::string settings = {};  // appended to kytreportingd.toml
  };
  // Null, with a line on standard error, when the daemon does not come up.
  [[nodiscard]] static std::unique_ptr<Stand> make(const Options& options);

  struct Load {
    size_t clients = 4;
    size_t threads = 0;  // that speak for them in turn; 0: as many as clients
    size_t each = 0;     // events of a client
    size_t perWrite = 20;
    double perSecond = 0;  // of each client, which begin one after the other; 0: as fast as the daemon reads
  };
  struct Run {
    bool whole = false;  // every event was posted and answered
    size_t events = 0;
    double wall = 0, processor = 0;  // seconds until the last answer; of the daemon and what it has started
    double bodyBytes = 0;
    uint64_t mostResident = 0;  // of all these processes, since they began
    [[nodiscard]] double microseconds() const { return processor / static_cast<double>(events) * 1e6; }
    [[nodiscard]] double rate() const { return static_cast<double>(events) / wall; }
    [[nodiscard]] double bytesEach() const { return bodyBytes / static_cast<double>(events); }
  };
  [[nodiscard]] Run post(const std::vector<std::string>& calls, const Load& load);

  // Sends `count` of these calls in writes of `perWrite`.
  static void send(Peer& peer, const std::vector<std::string>& calls, size_t count, size_t perWrite);
  // As many more as are missing; fewer when the daemon refuses one.
  void openSessions(std::vector<Peer>& peers, size_t wanted) const;
  // SIGTERM; seconds until the daemon has ended with status 0, none after a minute or with another.
  [[nodiscard]] std::optional<double> end();
  [[nodiscard]] int pid() { return stage_->daemon()->pid(); }
  [[nodiscard]] const std::string& folder() const { return stage_->folder(); }
  [[nodiscard]] std::string socketPath() const { return stage_->socketPath(); }
  [[nodiscard]] SinkServer& sink() { return sink_; }

 private:
  Stand() = default;
  SinkServer sink_{2, 40};
  std::unique_ptr<tools::Stage> stage_;
  int batch_ = 0;
};

}  // namespace kyt::bench
