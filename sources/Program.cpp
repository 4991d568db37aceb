#include "sources/Program.h"

#include <chrono>
#include <optional>

#include "platform/linux/cli/CommandLine.h"
#include "sources/Common.h"
#include "sources/Waiting.h"

namespace kyt::sources {

namespace {

using std::chrono::seconds;
using std::chrono::steady_clock;

constexpr seconds kLookInterval{5};

struct Options {
  CommonOptions common;
  std::string journal;
  SystemNames::Options names{{}, "/var/lib/dpkg/info", {}};
  int period = 900;
  bool once = false;
};

class Run {
 public:
  Run(const JournalProgram& program, const Options& options, Waiting& waiting)
      : program_(program),
        options_(options),
        waiting_(waiting),
        delivery_(options.common.delivery()),
        voice_(program.name) {}

  int run() {
    auto opened = Journal::open({options_.journal, program_.systemAlone, program_.matches});
    if (const auto* why = std::get_if<std::string>(&opened)) {
      voice_.say(*why);
      return 1;
    }
    Journal& journal = *std::get<std::unique_ptr<Journal>>(opened);
    Follower follower(
        journal, {options_.common.state, program_.category}, program_.finder(options_.names),
        [this](const std::vector<SourceEvent>& events) { return delivery_.deliver(events); },
        [] { return static_cast<uint64_t>(since1970().count()); });
    if (!follower.startProblem().empty()) voice_.say(follower.startProblem());
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
    voice_.tell(taken ? std::string() : "what was found waits, summed up: " + delivery_.problem());
    if (!follower.stateProblem().empty()) voice_.say(follower.stateProblem());
    return taken;
  }

  const JournalProgram& program_;
  const Options& options_;
  Waiting& waiting_;
  Delivery delivery_;
  Voice voice_;
};

}  // namespace

int runJournalProgram(const JournalProgram& program, int argc, char** argv) {
  Options options{.common = {program.name, program.clientType}, .journal = {}};
  const CommandLine line(program.name, program.description);
  line.option("--period", options.period, "Seconds from what was found to its report")
      .between(1, 86400)
      .showsDefault();
  options.common.addTo(line);
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
