// kytctl: the command for people: sends events, reads and writes user defaults, grants and withdraws the
// consent, shows and erases what is known of the owner, makes keys, signs and checks storebags, and shows how the running
// daemon stands.
#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <optional>
#include <string>

#include "platform/linux/cli/CommandLine.h"
#include "tools/kytctl/Arguments.h"

namespace {

using namespace kyt::tools;
using kyt::CommandLine;

// Says so, where it is not: who redirects it to a file would take a part for the whole.
bool isOutputWritten() {
  errno = 0;
  if (std::fflush(stdout) == 0 && std::ferror(stdout) == 0) return true;
  const std::string why = errno != 0 ? std::string(": ") + std::strerror(errno) : std::string();
  failed("can't write the output" + why);
  return false;
}

}  // namespace

int main(int argc, char** argv) {
  const CommandLine program("kytctl", "The command for people around kytreportingd");
  Arguments arguments;
  program.option("--root", arguments.connection.root,
                 "A folder that stands in front of every fixed path, as the daemon's --root");
  program.needsCommand();
  program.takesOptionsAnywhere();
  addSend(program, arguments);
  addListen(program, arguments);
  addExplain(program, arguments);
  addDefaults(program, arguments);
  addOwner(program, arguments);
  addEntitlements(program, arguments);
  addStorebag(program, arguments);
  addEvents(program, arguments);
  addWindow(program, arguments);
  addOutbox(program, arguments);
  const std::optional<int> ended = program.parse(argc, argv);
  const int status = ended.value_or(arguments.status);
  return isOutputWritten() ? status : std::max(status, arguments.unwritten);
}
