// The frame of a source that follows the journal: command line, signals, when to look and when to report. Nothing wakes
// it while the journal has nothing new; while it has, a look begins at most every five seconds.
#pragma once

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

#include "sources/Follower.h"
#include "sources/Names.h"

namespace kyt::sources {

struct JournalProgram {
  const char* name = "";         // also its "ClientName" and the name of its state's folder
  const char* description = "";  // of the help
  uint32_t category = 0;
  uint8_t clientType = 0;  // where the command line names none
  bool systemAlone = true;
  std::vector<std::string> matches;
  // What it finds; told what a report may name.
  std::function<Finder(SystemNames::Options)> finder;
};
// The exit status: 0 after SIGTERM or SIGINT, 1 when the journal cannot be read (with --once: or the report was not
// taken), 2 when the command line is wrong.
[[nodiscard]] int runJournalProgram(const JournalProgram& program, int argc, char** argv);

}  // namespace kyt::sources
