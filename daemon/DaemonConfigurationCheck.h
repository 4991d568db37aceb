// `kytreportingd --check-config`: reads everything that an administrator writes, as the daemon reads it, and says what is
// wrong with it: file, line, and the nearest known key. Nothing is changed and no daemon is spoken to.
#pragma once

#include <string>
#include <vector>

#include "daemon/Daemon.h"

namespace kyt {

// "FILE:LINE: what is wrong", for each mistake; empty: none.
[[nodiscard]] std::vector<std::string> configurationProblems(const DaemonOptions& options);

// Prints them, or that there is none, and which files among the grants are not read, which is no mistake; returns the
// process's exit status: 1, or 0.
[[nodiscard]] int checkConfiguration(const DaemonOptions& options);

}  // namespace kyt
