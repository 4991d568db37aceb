// A call on its way through a session's queue, with what the library keeps about it. Made on any thread, handled on the
// library's thread.
#pragma once

#include <chrono>
#include <optional>
#include <string>
#include <utility>

#include "client/Call.h"

namespace kyt::client {

using SteadyTime = std::chrono::steady_clock::time_point;

struct Command {
  explicit Command(Call what) : call(std::move(what)) {}

  Call call;
  bool replayed = false;  // the library's own, to a daemon that came back
  bool given = true;      // false: its completion was told that it is not sent any more
  // Until when its completion waits for a daemon; none: for ever.
  std::optional<SteadyTime> deadline = std::nullopt;

  // A message with an answer, and not one of the calls about the session.
  [[nodiscard]] bool isMessage() const {
    return call.method == Method::sendMessageWithDictionary ||
           call.method == Method::sendMessageWithSessionInfo;
  }
  // Whether the daemon gets it even if nobody waits for the answer any more: it says what the session is.
  [[nodiscard]] bool staysGiven() const;
};

// What is wrong with a message of which one of the two is more than 65535.
[[nodiscard]] std::string outOfRange(uint32_t category, uint32_t type);

}  // namespace kyt::client
