// kytsource-resources: looks at the machine every minute, and reports lowest, mean and highest values every quarter of an
// hour. What is not taken by the daemon stays in the period, which then lasts longer. One thread besides the library's.
#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <optional>

#include "platform/base/TextEscape.h"
#include "platform/linux/cli/CommandLine.h"
#include "sources/Delivery.h"
#include "sources/State.h"
#include "sources/Waiting.h"
#include "sources/resources/ResourcePeriod.h"

namespace kyt::sources {
namespace {

using std::chrono::seconds;
using std::chrono::steady_clock;

constexpr char kName[] = "kytsource-resources";
constexpr uint32_t kCategory = 304, kResources = 1;

struct Options {
  std::string socket, state, root;
  int period = 900, interval = 60, clientType = 21, patience = 30;
};

uint64_t microseconds(steady_clock::time_point time) {
  return static_cast<uint64_t>(
      std::chrono::duration_cast<std::chrono::microseconds>(time.time_since_epoch()).count());
}

class Resources {
 public:
  explicit Resources(const Options& options)
      : options_(options),
        delivery_(
            {options.socket, kName, static_cast<uint8_t>(options.clientType), seconds(options.patience)}),
        period_(options.root),
        state_(readState(options.state).value_or(State{})) {}

  int run(Waiting& waiting) {
    const seconds interval(std::min(options_.interval, options_.period));
    auto reportAt = steady_clock::now() + seconds(options_.period);
    auto lookAt = steady_clock::now();
    while (true) {
      period_.sample(microseconds(steady_clock::now()));
      if (steady_clock::now() >= reportAt) {
        report();
        reportAt = steady_clock::now() + seconds(options_.period);
      }
      lookAt = std::max(lookAt + interval, steady_clock::now());
      if (waiting.wait(-1, std::min(lookAt, reportAt)) == Waiting::Woken::stop) break;
    }
    period_.sample(microseconds(steady_clock::now()));
    report();
    return 0;
  }

 private:
  void report() {
    if (begun_ && !handOver(*begun_).isWhole()) return;
    begun_.reset();
    Dictionary fields = period_.summary();
    fields.set("waits", waits_);
    fields.set("report", state_.report);
    SourceEvent event{kCategory, kResources, std::move(fields)};
    const Handover handover = handOver(event);
    if (!handover.offered) return;
    period_.restart();
    // Its number is used, whatever became of it.
    ++state_.report;
    if (const auto problem = writeState(options_.state, state_)) tell(*problem);
    if (!handover.isWhole()) begun_ = std::move(event);
  }
  Handover handOver(const SourceEvent& event) {
    Handover handover = delivery_.deliver({event});
    waits_ = handover.isWhole() ? 0 : waits_ + 1;
    tell(handover.isWhole() ? std::string() : "the summary waits: " + delivery_.problem());
    return handover;
  }
  // Once for each problem, however long it lasts.
  void tell(std::string problem) {
    if (!problem.empty() && problem != told_)
      std::fprintf(stderr, "%s: %s\n", kName, escapedText(problem).c_str());
    told_ = std::move(problem);
  }

  const Options& options_;
  Delivery delivery_;
  ResourcePeriod period_;
  State state_;
  // Handed over, and the daemon did not say that it has it: it is tried again as it is.
  std::optional<SourceEvent> begun_;
  uint64_t waits_ = 0;
  std::string told_;
};

}  // namespace
}  // namespace kyt::sources

int main(int argc, char** argv) {
  using namespace kyt::sources;
  Options options;
  const char* folder = std::getenv("STATE_DIRECTORY");
  options.state = (folder != nullptr ? std::string(folder) : "/var/lib/" + std::string(kName)) + "/state";
  const kyt::CommandLine line(kName, "Reports how busy the machine is");
  line.option("--period", options.period, "Seconds that a report sums up").between(1, 86400).showsDefault();
  line.option("--interval", options.interval, "Seconds between two looks").between(1, 3600).showsDefault();
  line.option("--client-type", options.clientType, "The session's client type").between(5, 23).showsDefault();
  line.option("--patience", options.patience, "Seconds that a report may take")
      .between(1, 300)
      .showsDefault();
  line.option("--socket", options.socket, "The daemon's socket");
  line.option("--state", options.state, "The file with the number of the next report").showsDefault();
  line.option("--root", options.root, "A folder in front of /proc, /sys and /var");
  if (const auto status = line.parse(argc, argv)) return *status;
  Waiting waiting;
  if (!waiting.works()) return 1;
  return Resources(options).run(waiting);
}
