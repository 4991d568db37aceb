#include "sources/Program.h"

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <optional>

#include "platform/base/TextEscape.h"
#include "platform/linux/cli/CommandLine.h"
#include "sources/Delivery.h"
#include "sources/Waiting.h"

namespace kyt::sources {

namespace {

using std::chrono::seconds;
using std::chrono::steady_clock;

constexpr seconds kLookInterval{5};

struct Options {
  std::string journal, socket, state;
  SystemNames::Options names{{}, "/var/lib/dpkg/info", {}};
  int period = 900, clientType = 0, patience = 30;
  bool once = false;
};

uint64_t microsecondsSince1970() {
  const auto time = std::chrono::system_clock::now().time_since_epoch();
  return static_cast<uint64_t>(std::chrono::duration_cast<std::chrono::microseconds>(time).count());
}

std::string stateFile(const JournalProgram& program) {
  const char* folder = std::getenv("STATE_DIRECTORY");
  return (folder != nullptr ? std::string(folder) : std::string("/var/lib/") + program.name) + "/state";
}

class Run {
 public:
  Run(const JournalProgram& program, const Options& options, Waiting& waiting)
      : program_(program),
        options_(options),
        waiting_(waiting),
        delivery_({options.socket, program.name, static_cast<uint8_t>(options.clientType),
                   seconds(options.patience)}) {}

  int run() {
    auto opened = Journal::open({options_.journal, program_.systemAlone, program_.matches});
    if (const auto* why = std::get_if<std::string>(&opened)) {
      say(*why);
      return 1;
    }
    Journal& journal = *std::get<std::unique_ptr<Journal>>(opened);
    Follower follower(
        journal, {options_.state, program_.category}, program_.finder(options_.names),
        [this](const std::vector<SourceEvent>& events) { return delivery_.deliver(events); },
        microsecondsSince1970);
    return options_.once ? once(follower) : follow(journal, follower);
  }

 private:
  int once(Follower& follower) {
    do follower.look();
    while (follower.isBehind());
    return report(follower) ? 0 : 1;
  }
  int follow(Journal& journal, Follower& follower) {
    std::optional<steady_clock::time_point> reportAt;
    while (true) {
      journal.takeNews();
      follower.look();
      const auto looked = steady_clock::now();
      if (follower.hasFindings() && !reportAt) reportAt = looked + seconds(options_.period);
      if (reportAt && looked >= *reportAt) {
        static_cast<void>(report(follower));
        reportAt.reset();
        continue;
      }
      const auto nextLook = looked + std::min(kLookInterval, seconds(options_.period));
      if (waiting_.wait(-1, nextLook) == Waiting::Woken::stop ||
          (!follower.isBehind() && waiting_.wait(journal.descriptor(), reportAt) == Waiting::Woken::stop))
        break;
    }
    if (follower.hasFindings()) static_cast<void>(report(follower));
    return 0;
  }
  bool report(Follower& follower) {
    const bool taken = follower.report();
    tell(taken ? std::string() : "what was found waits, summed up: " + delivery_.problem());
    if (!follower.stateProblem().empty()) say(follower.stateProblem());
    return taken;
  }
  // Once for each problem, however long it lasts.
  void tell(std::string problem) {
    if (!problem.empty() && problem != told_) say(problem);
    told_ = std::move(problem);
  }
  void say(const std::string& text) const {
    std::fprintf(stderr, "%s: %s\n", program_.name, escapedText(text).c_str());
  }

  const JournalProgram& program_;
  const Options& options_;
  Waiting& waiting_;
  Delivery delivery_;
  std::string told_;
};

}  // namespace

int runJournalProgram(const JournalProgram& program, int argc, char** argv) {
  Options options;
  options.clientType = program.clientType;
  options.state = stateFile(program);
  const CommandLine line(program.name, program.description);
  line.option("--period", options.period, "Seconds from what was found to its report")
      .between(1, 86400)
      .showsDefault();
  line.option("--client-type", options.clientType, "The session's client type").between(5, 23).showsDefault();
  line.option("--patience", options.patience, "Seconds that a report may take")
      .between(1, 300)
      .showsDefault();
  line.option("--socket", options.socket, "The daemon's socket");
  line.option("--state", options.state, "The file that says what was reported").showsDefault();
  line.option("--journal", options.journal, "A folder of journal files in place of this machine's");
  line.option("--units-from", options.names.unitFolders,
              "A folder of units that a report may name (/usr/lib/systemd/system)")
      .repeatable();
  line.option("--packages", options.names.packages, "A folder with the packages' lists of files")
      .showsDefault();
  line.flag("--once", options.once, "Report what is there, and end");
  if (const auto status = line.parse(argc, argv)) return *status;
  if (options.names.unitFolders.empty()) options.names.unitFolders.emplace_back("/usr/lib/systemd/system");
  Waiting waiting;
  if (!waiting.works()) return 1;
  return Run(program, options, waiting).run();
}

}  // namespace kyt::sources
