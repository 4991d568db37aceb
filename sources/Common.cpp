#include "sources/Common.h"

#include <cstdio>
#include <cstdlib>

#include "platform/base/TextEscape.h"
#include "platform/linux/cli/CommandLine.h"

namespace kyt::sources {

CommonOptions::CommonOptions(const char* name, int type) : program(name), clientType(type) {
  const char* folder = std::getenv("STATE_DIRECTORY");
  state = (folder != nullptr ? std::string(folder) : "/var/lib/" + program) + "/state";
}

void CommonOptions::addTo(const CommandLine& line) {
  line.option("--client-type", clientType, "The session's client type").between(5, 23).showsDefault();
  line.option("--patience", patience, "Seconds that a report may take").between(1, 300).showsDefault();
  line.option("--socket", socket, "The daemon's socket");
  line.option("--state", state, "The file that says what was reported").showsDefault();
}

Delivery::Options CommonOptions::delivery() const {
  return {socket, program, static_cast<uint8_t>(clientType), std::chrono::seconds(patience)};
}

void Voice::say(const std::string& text) const {
  std::fprintf(stderr, "%s: %s\n", program_.c_str(), escapedText(text).c_str());
}

void Voice::tell(std::string problem) {
  if (!problem.empty() && problem != told_) say(problem);
  told_ = std::move(problem);
}

std::chrono::microseconds since1970() {
  return std::chrono::duration_cast<std::chrono::microseconds>(
      std::chrono::system_clock::now().time_since_epoch());
}

State stateAtStart(const CommonOptions& options, const Voice& voice) {
  std::string problem;
  State state = stateAtStart(options.state, std::chrono::floor<std::chrono::seconds>(since1970()), problem);
  if (!problem.empty()) voice.say(problem);
  return state;
}

}  // namespace kyt::sources
