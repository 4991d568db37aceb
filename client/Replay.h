// What a daemon is told first on each new connection. What does not fit into one message goes in pieces. The library's
// thread only.
#pragma once

#include <cstdint>

#include "client/KeptState.h"
#include "platform/base/Function.h"

namespace kyt::client {

struct Replayed {
  // False: the daemon cannot be told who the session is. Then nothing else may be sent, since the rules for what it
  // sends would not be known.
  bool identified = true;
  uint64_t failed = 0;  // values that cannot be sent
};

// Tells `kept` in calls, by `send`, which returns false for a call that cannot be written.
[[nodiscard]] Replayed replay(const KeptState& kept, Function<bool(Call)> send);

}  // namespace kyt::client
