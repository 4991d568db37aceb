// What the journal says about programs that ended by a crash, as systemd-coredump writes it.
#pragma once

#include "sources/Program.h"

namespace kyt::sources {

// {"program", "unit", "signal"} of a crash (type 1). Never the core, the command line, the environment, the program's
// own name for itself, or whose it was.
inline constexpr uint32_t kProgramCrashed = 1;
[[nodiscard]] JournalProgram crashesProgram();

}  // namespace kyt::sources
