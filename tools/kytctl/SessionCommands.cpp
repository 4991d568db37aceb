// A scripted session: the lines of a file or of standard input, each a step.
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <iostream>

#include "platform/linux/data/RapidJSON.h"
#include "tools/kytctl/Commands.h"
#include "tools/kytctl/SessionScript.h"

namespace kyt::tools {

int sessionCommand(const ConnectionOptions& connection, const std::string& path) {
  // Line by line, so that a person or a program may decide on the next step after the last one's answer.
  std::ifstream file;
  if (path != "-") {
    file.open(path);
    if (!file) return failed(path + ": " + std::strerror(errno));
  }
  std::istream& lines = path == "-" ? std::cin : file;
  RapidJSON json;
  SessionScript script(connection);
  std::string line;
  for (int number = 1; std::getline(lines, line); ++number) {
    if (line.find_first_not_of(" \t\r") == std::string::npos || line[line.find_first_not_of(" \t")] == '#')
      continue;
    auto step = json.parse(line);
    if (auto* error = std::get_if<Error>(&step))
      return failed("line " + std::to_string(number) + ": " + error->localizedDescription);
    const Dictionary* dictionary = std::get<Value>(step).dictionary();
    if (dictionary == nullptr) return failed("line " + std::to_string(number) + ": a step is a JSON object");
    if (const int status = script.run(*dictionary); status != 0) return status;
    std::fflush(stdout);
  }
  script.end();
  return 0;
}

}  // namespace kyt::tools
