// What the service manager's journal says about units that failed or are started again.
#pragma once

#include "sources/Program.h"

namespace kyt::sources {

// {"unit", "result"} of a unit that failed (type 1), {"unit"} of one that is started again (type 2).
inline constexpr uint32_t kUnitFailed = 1, kUnitRestarted = 2;
[[nodiscard]] JournalProgram unitsProgram();

}  // namespace kyt::sources
