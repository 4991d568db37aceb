// What has not left the device yet, for its owner: the running daemon's books say it; without one nothing is in memory, and
// only what the outbox keeps lies on the disk. Asked once, by the constructor, which may wait for the daemon's answer.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <string>
#include <vector>

#include "platform/objects/Value.h"
#include "tools/kytctl/WaitingPosts.h"

namespace kyt::tools {

class WaitingEvents {
 public:
  // Beneath the root.
  explicit WaitingEvents(const std::string& root);
  // daemon (its process; null: none runs), rows of user, clientType, client, service, backEnd, internal, queued, batched,
  // inFlight, waiting, outbox; problem (why the daemon did not say it); outboxBytes (of the file; 0: there is none), outbox
  // (what is in it: WaitingPosts.h).
  [[nodiscard]] Dictionary object() const;
  // Lines of at most 100 characters, but for paths.
  [[nodiscard]] std::string text() const;

 private:
  [[nodiscard]] std::string rowsText() const;

  pid_t daemon_ = -1;  // 0 and below: none runs
  std::vector<Dictionary> rows_;
  std::string problem_, outbox_;
  uint64_t outboxBytes_ = 0;
  WaitingPosts posts_;
};

}  // namespace kyt::tools
