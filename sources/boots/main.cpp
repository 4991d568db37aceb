// kytsource-boots: once after each start of the system, reports how earlier runs ended, and that this one began; then it
// ends. One thread besides the library's.
#include <algorithm>
#include <charconv>
#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>

#include "platform/linux/cli/CommandLine.h"
#include "sources/Common.h"
#include "sources/Waiting.h"
#include "sources/boots/EndedBoots.h"
#include "sources/boots/Events.h"

namespace kyt::sources {
namespace {

using std::chrono::seconds;
using std::chrono::steady_clock;

constexpr char kName[] = "kytsource-boots";
constexpr uint64_t kMicroseconds = 1'000'000;
constexpr size_t kMostBoots = 100;  // in one report; of more, the latest

struct Options {
  CommonOptions common{kName, 12};
  std::string journal, root, pstore, boot;
  int settle = 300, retry = 900;
  bool once = false;
};

// The kernel's, as the journal writes it: without hyphens.
std::string currentBoot(const Options& options) {
  std::string text;
  std::ifstream(options.root + "/proc/sys/kernel/random/boot_id") >> text;
  std::erase(text, '-');
  return text;
}

// The bit that Linux's interface to watchdogs has for "reset the machine before".
bool watchdogFired(const Options& options) {
  constexpr unsigned kCardReset = 0x20;
  std::error_code error;
  for (const auto& device :
       std::filesystem::directory_iterator(options.root + "/sys/class/watchdog", error)) {
    std::string text;
    if (!(std::ifstream(device.path() / "bootstatus") >> text)) continue;
    if ((std::strtoul(text.c_str(), nullptr, 0) & kCardReset) != 0) return true;
  }
  return false;
}

// The state's position: "@", the end of the last run that was told, ";", the run whose beginning was told.
struct Told {
  uint64_t until = 0;
  std::string began;
};
Told toldBy(const std::string& position) {
  Told told;
  if (!position.starts_with("@")) return told;
  std::from_chars(position.data() + 1, position.data() + position.size(), told.until);
  if (const size_t at = position.find(';'); at != std::string::npos) told.began = position.substr(at + 1);
  return told;
}

class Boots {
 public:
  explicit Boots(const Options& options)
      : options_(options),
        current_(options.boot.empty() ? currentBoot(options) : options.boot),
        delivery_(options.common.delivery()),
        state_(stateAtStart(options.common, voice_)) {}

  int run(Waiting& waiting) {
    // Until the service manager is done with the start, so that it can say how long that took.
    const auto settled = steady_clock::now() + seconds(options_.once ? 0 : options_.settle);
    while (!startupMilliseconds(options_.journal, current_) && steady_clock::now() < settled)
      if (waiting.wait(-1, std::min(settled, steady_clock::now() + seconds(10))) == Waiting::Woken::stop)
        return 0;
    while (!report()) {
      if (options_.once) return 1;
      if (waiting.wait(-1, steady_clock::now() + seconds(options_.retry)) == Waiting::Woken::stop) return 0;
    }
    return 0;
  }

 private:
  bool report() {
    Told told = toldBy(state_.position);
    const bool isFirst = state_.position.empty();
    EndedBoots ended = endedBoots(
        options_.journal, current_, told.until,
        {watchdogFired(options_), panicDumps(options_.pstore.empty() ? options_.root : options_.pstore)});
    if (!ended.problem.empty()) return tell(ended.problem);
    if (!ended.boots.empty()) told.until = ended.boots.back().ended;
    // What was before the service was enabled is not told.
    if (isFirst) ended.boots.clear();
    if (ended.boots.size() > kMostBoots)
      ended.boots.erase(ended.boots.begin(), ended.boots.end() - static_cast<ptrdiff_t>(kMostBoots));
    const std::vector<SourceEvent> found = eventsOf(ended.boots, told.began != current_, state_.report);
    if (!delivery_.deliver(found).isWhole()) return tell("the report waits: " + delivery_.problem());
    if (!found.empty()) ++state_.report;
    state_.position = "@" + std::to_string(told.until) + ";" + current_;
    if (const auto problem = writeState(options_.common.state, state_)) voice_.say(*problem);
    return true;
  }
  [[nodiscard]] std::vector<SourceEvent> eventsOf(const std::vector<EndedBoot>& boots, bool tellsBegin,
                                                  uint64_t report) const {
    std::vector<SourceEvent> told;
    for (const EndedBoot& boot : boots)
      told.push_back(sourceEvent(events::BootEnded{.reason = boot.reason,
                                                   .seconds = (boot.ended - boot.began) / kMicroseconds,
                                                   .ended = boot.ended / kMicroseconds,
                                                   .report = report}));
    if (tellsBegin)
      told.push_back(sourceEvent(events::BootBegan{
          .startupMilliseconds = startupMilliseconds(options_.journal, current_), .report = report}));
    return told;
  }
  [[nodiscard]] bool tell(std::string problem) {
    voice_.tell(std::move(problem));
    return false;
  }

  const Options& options_;
  const std::string current_;
  Voice voice_{kName};
  Delivery delivery_;
  State state_;
};

}  // namespace
}  // namespace kyt::sources

int main(int argc, char** argv) {
  using namespace kyt::sources;
  Options options;
  const kyt::CommandLine line(kName, "Reports how earlier runs of the system ended, and that it started");
  line.option("--settle", options.settle, "Seconds to wait for the end of the start")
      .between(0, 3600)
      .showsDefault();
  line.option("--retry", options.retry, "Seconds until a report is tried again")
      .between(1, 86400)
      .showsDefault();
  options.common.addTo(line);
  line.option("--journal", options.journal, "A folder of journal files in place of this machine's");
  line.option("--root", options.root, "A folder in front of /proc and /sys");
  line.option("--pstore", options.pstore, "A folder in front of the kernels' dumps instead");
  line.option("--boot", options.boot, "The identifier of this run, as the journal has it");
  line.flag("--once", options.once, "Wait for nothing, and try once");
  if (const auto status = line.parse(argc, argv)) return *status;
  Waiting waiting;
  if (!waiting.works()) return 1;
  return Boots(options).run(waiting);
}
