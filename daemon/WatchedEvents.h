// How watchers ask for events and how they are told of them, and how administrators choose posts of the outbox, as
// dictionaries: docs/com.vantu.kytreportingd.Administration.xml has the keys. No state; any thread.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "platform/base/Watchers.h"
#include "platform/objects/Value.h"

namespace kyt {

// What is wrong with it, for people; null: nothing.
[[nodiscard]] const char* readWatchFilter(const Dictionary& wanted, WatchFilter& filter);
struct OutboxFilter {
  std::optional<std::string> server;
  std::optional<uint32_t> user;
};
[[nodiscard]] const char* readOutboxFilter(const Dictionary& wanted, OutboxFilter& filter);
[[nodiscard]] Dictionary passedView(const PassedEvent& event, bool bodies);

}  // namespace kyt
