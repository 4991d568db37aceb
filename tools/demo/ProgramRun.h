// One program of somebody's on the stage: the whole chain around it, then what became of what it reported.
#pragma once

#include <string>
#include <vector>

namespace kyt::tools {

class Stage;

// Puts storebags that take everything of any client, starts the daemon, runs the program with KYTREPORTING_SOCKET in its
// environment until it ends, and prints what arrived at the server, what was dropped and why. Returns the program's own
// status, or 1 where the stage failed, which is said on standard error.
[[nodiscard]] int runProgramOn(Stage& stage, const std::vector<std::string>& program);

}  // namespace kyt::tools
