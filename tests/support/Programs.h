// Runs a program to its end and keeps what it printed: the tools and the stock clients that tests drive.
#pragma once

#include <chrono>
#include <string>
#include <utility>
#include <vector>

#include "tests/support/TemporaryFolder.h"
#include "tools/demo/ChildProcess.h"

namespace kyt {

struct ProgramRun {
  int status = -1;   // -1: it could not be started, or did not end in time
  std::string text;  // standard output and standard error
};

inline ProgramRun runProgram(const std::string& program, const std::vector<std::string>& arguments,
                             const std::string& input = {},
                             std::chrono::milliseconds timeout = std::chrono::seconds(60)) {
  const TemporaryFolder folder;
  tools::ChildProcess::Options how;
  how.outputFile = folder / "output";
  if (!input.empty()) how.inputFile = folder.write("input", input);
  auto child = tools::ChildProcess::start(program, arguments, how);
  if (!child) return {};
  const auto status = child->wait(timeout);
  return {status.value_or(-1), folder.read("output")};
}

// Whether the program is on this machine: a test that needs it is skipped otherwise, visibly.
inline bool isInstalled(const std::string& program) {
  return runProgram("sh", {"-c", "PATH=$PATH:/usr/sbin:/sbin command -v " + program}).status == 0;
}

}  // namespace kyt
