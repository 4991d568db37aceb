// Ports of the loopback for servers that must be told theirs.
#pragma once

#include <cstdint>

namespace kyt::tools {

// One on which nobody listens at this moment, below those that the system gives to connections: none of these takes it before
// the server does, nor while that is down for a while. 0: all that were tried are taken.
[[nodiscard]] uint16_t freePort();
// Whether somebody takes connections there.
[[nodiscard]] bool takesConnections(uint16_t port);

}  // namespace kyt::tools
