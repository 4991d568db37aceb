// The composition root: the one place that makes every object of the daemon, hands references down, and takes
// the whole down again in reverse. Nothing else in the daemon includes an adapter of the operating system.
//
// runDaemon() is called on the main thread, before any other thread exists. It reads the settings, confines the
// process, and then makes everything else; it returns when the daemon has ended in an orderly way, or could not
// start. Where threads do not end it ends the process itself, with the same status.
#pragma once

#include <optional>
#include <string>

#include "platform/base/LogLevel.h"

namespace kyt {

struct DaemonOptions {
  std::string root;                  // stands in front of every fixed path; empty: none
  std::string config;                // the settings' file; empty: the fixed one
  std::optional<LogLevel> logLevel;  // instead of the settings'
  std::string version;               // of the program, for administrators
};

// The process's exit status: 0 after an orderly end; 1 when it could not start, or ended in order since the system
// refused memory; -1 (255) when it could not be confined.
[[nodiscard]] int runDaemon(const DaemonOptions& options);

}  // namespace kyt
