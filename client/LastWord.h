// One event that is encoded beforehand, on a connection of its own, for a handler of a signal to send. Any thread.
#pragma once

#include <optional>

#include "kytreporting/KYTReporting.h"
#include "platform/linux/client/LastSocket.h"

namespace kyt::client {

// None where the event cannot be meant or sent so, or the socket's path is too long.
[[nodiscard]] std::optional<linux_client::LastSocket> lastWord(KYTReporting::Options options,
                                                               uint32_t category, uint32_t type,
                                                               std::optional<Dictionary> payload);

}  // namespace kyt::client
