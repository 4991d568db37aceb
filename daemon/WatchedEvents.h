// How watchers ask for events and how they are told of them, as dictionaries: docs/com.vantu.kytreportingd.Administration.xml
// has the keys. No state; any thread.
#pragma once

#include "platform/base/Watchers.h"
#include "platform/objects/Value.h"

namespace kyt {

// What is wrong with it, for people; null: nothing.
[[nodiscard]] const char* readWatchFilter(const Dictionary& wanted, WatchFilter& filter);
[[nodiscard]] Dictionary passedView(const PassedEvent& event, bool bodies);

}  // namespace kyt
