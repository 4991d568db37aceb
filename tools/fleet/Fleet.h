// The whole receiving end of a fleet on one machine, with real servers: nginx, receivers, a log of three nodes that keeps
// each post three times, the reader, and PostgreSQL; beside a Stage with a daemon whose storebags send posts there. For
// `./kyt fleet` and its checks. One thread, but for queries, which any may make.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <variant>
#include <vector>

#include "platform/base/Error.h"
#include "tools/demo/ChildProcess.h"
#include "tools/demo/Stage.h"
#include "tools/fleet/Front.h"
#include "tools/fleet/Postgres.h"

namespace kyt::tools {

struct FleetOptions {
  Stage::Options stage;
  std::string site;  // of nginx
  size_t receivers = 2;
};

// The path of posts without a digest; the daemon's own are below it.
inline constexpr char kFleetPath[] = "/v1/events/kytdemo-plain";

class Fleet {
 public:
  // All of it runs when this returns; the daemon is the stage's to start.
  [[nodiscard]] static std::variant<std::unique_ptr<Fleet>, Error> start(FleetOptions options);
  ~Fleet();
  Fleet(const Fleet&) = delete;
  Fleet& operator=(const Fleet&) = delete;

  [[nodiscard]] Stage& stage() { return *stage_; }
  [[nodiscard]] const Front& front() const { return *front_; }
  [[nodiscard]] Postgres& postgres() { return *postgres_; }

  [[nodiscard]] size_t nodes() const { return nodes_.size(); }
  // Which node leads the stream of posts; none: nobody does, or nobody says.
  [[nodiscard]] std::optional<size_t> leader() const;
  [[nodiscard]] bool isNodeRunning(size_t node) { return nodes_[node].process.isRunning(); }
  void killNode(size_t node);
  [[nodiscard]] std::optional<Error> startNode(size_t node);

  [[nodiscard]] size_t receivers() const { return receivers_.size(); }
  // SIGKILL, or SIGTERM and its exit status.
  void killReceiver(size_t receiver);
  [[nodiscard]] std::optional<int> endReceiver(size_t receiver);
  [[nodiscard]] std::optional<Error> startReceiver(size_t receiver);
  // A figure as its metrics show it, as "kyt_spool_posts"; none: it gives none.
  [[nodiscard]] std::optional<double> figure(size_t receiver, const std::string& sample) const;
  // Of all receivers that give it.
  [[nodiscard]] double sum(const std::string& sample) const;

  // What each server said, for whoever looks for a fault.
  [[nodiscard]] const std::string& folder() const { return stage_->folder(); }

 private:
  struct Node {
    uint16_t port = 0, routes = 0, monitor = 0;
    ChildProcess process;
  };
  struct Receiver {
    uint16_t port = 0, metrics = 0;
    ChildProcess process;
  };
  Fleet() = default;
  [[nodiscard]] std::string nodeFile(size_t node, const char* ending) const;
  [[nodiscard]] std::string receiverFile(size_t receiver, const char* ending) const;
  [[nodiscard]] std::optional<Error> startLog();
  [[nodiscard]] std::optional<Error> startReceivers(size_t count);
  [[nodiscard]] std::optional<Error> makeStreams();
  [[nodiscard]] std::optional<Error> startReader();
  [[nodiscard]] std::optional<Error> startFront(const std::string& site);

  // Ended in the reverse order.
  std::unique_ptr<Postgres> postgres_;
  std::unique_ptr<Stage> stage_;
  std::vector<Node> nodes_;
  ChildProcess reader_;
  std::vector<Receiver> receivers_;
  std::optional<Front> front_;
};

}  // namespace kyt::tools
