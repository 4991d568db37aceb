// What a post's answer means for the outbox. Pure functions.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/URLSession.h"
#include "platform/base/Clock.h"

namespace kyt {

enum class PostVerdict : uint8_t {
  taken,
  sendAgain,   // no answer, or one that says that another time may do better
  redirected,  // not followed
  refused,     // for good: 4xx
  braked,      // another 5xx: the operator wants to hear nothing for now
};

// The status that a server has decided on counts even if its reply broke off.
[[nodiscard]] PostVerdict verdictOf(const URLResponse* response, const Error* error);

// How long the server wants to be left alone, at most a day: "Retry-After" in seconds or as a date of HTTP. `now`
// counts where the answer has no "Date".
[[nodiscard]] std::optional<Duration> retryAfter(const URLResponse* response, TimeValue now);

// Scheme, host and port of an address, in lower case: what one line of posts is for.
[[nodiscard]] std::string serverOfLine(std::string_view url);

}  // namespace kyt
