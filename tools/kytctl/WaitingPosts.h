// What waits in the outbox, for the owner of the device: asked of the daemon where it runs, which has the file for itself, and
// read from the file where it does not.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "platform/base/Paths.h"
#include "platform/objects/Value.h"

namespace kyt::tools {

struct WaitingPosts {
  struct Server {
    std::string server;
    uint64_t posts = 0, bytes = 0;
    int64_t oldest = 0;  // seconds since 1970 when it was kept; 0: not known
  };
  std::vector<Server> servers;
  std::optional<std::string> problem;  // why that cannot be told

  [[nodiscard]] static WaitingPosts of(const std::string& root, const Paths& paths, bool daemonRuns);
  [[nodiscard]] uint64_t posts() const;
  // For programs: posts, and servers with server, posts, bytes, oldest; null where that cannot be told.
  [[nodiscard]] Value object() const;
  // For people, a line for each server.
  [[nodiscard]] std::string text() const;
};

// Each post as it would be sent: server, kept, headers, body. Only while no daemon runs.
[[nodiscard]] Array postsThatWait(const Paths& paths);

}  // namespace kyt::tools
