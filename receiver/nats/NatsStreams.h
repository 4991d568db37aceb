// The streams that the receivers fill, as the settings say: "kyt-events" or another name, which refuses what finds no room and
// lets posts go with their age, and "kyt-dead-letters", which also forgets its oldest past 1 GiB.
#pragma once

#include <nats/nats.h>

#include <optional>
#include <string>
#include <vector>

#include "receiver/Settings.h"

namespace kyt::receiver {

inline constexpr char kDeadSubject[] = "kyt.dead", kDeadStream[] = "kyt-dead-letters";

struct StreamsMade {
  std::optional<std::string> problem;
  std::vector<std::string> differences;  // of streams that were there, a sentence each, for people
};

// Makes those that are missing. One that is there is changed where `updates`; otherwise it stays, and how it differs from the
// settings is told. Blocks.
[[nodiscard]] StreamsMade makeStreams(jsCtx* context, const LogSettings& settings, bool updates);

}  // namespace kyt::receiver
