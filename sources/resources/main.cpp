// kytsource-resources: looks at the machine every minute, and reports lowest, mean and highest values every quarter of an
// hour. What is not taken by the daemon stays in the period, which then lasts longer. One thread besides the library's.
#include <algorithm>
#include <chrono>
#include <optional>

#include "platform/linux/cli/CommandLine.h"
#include "sources/Common.h"
#include "sources/Waiting.h"
#include "sources/resources/ResourcePeriod.h"

namespace kyt::sources {
namespace {

using std::chrono::seconds;
using std::chrono::steady_clock;

constexpr char kName[] = "kytsource-resources";
constexpr uint32_t kCategory = 304, kResources = 1;

struct Options {
  CommonOptions common{kName, 21};
  std::string root;
  int period = 900, interval = 60;
};

uint64_t microseconds(steady_clock::time_point time) {
  return static_cast<uint64_t>(
      std::chrono::duration_cast<std::chrono::microseconds>(time.time_since_epoch()).count());
}

class Resources {
 public:
  explicit Resources(const Options& options)
      : options_(options),
        delivery_(options.common.delivery()),
        period_(options.root),
        state_(stateAtStart(options.common, voice_)) {}

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
    if (begun_ && !handOver(*begun_).isWhole()) {
      ++waits_;
      return;
    }
    begun_.reset();
    Dictionary fields = period_.summary();
    fields.set("waits", waits_);
    fields.set("report", state_.report);
    SourceEvent event{kCategory, kResources, std::move(fields)};
    const Handover handover = handOver(event);
    if (!handover.offered) {
      ++waits_;
      return;
    }
    waits_ = handover.isWhole() ? 0 : 1;  // those before stand in this one
    period_.restart();
    // Its number is used, whatever became of it.
    ++state_.report;
    if (const auto problem = writeState(options_.common.state, state_)) voice_.say(*problem);
    if (!handover.isWhole()) begun_ = std::move(event);
  }
  Handover handOver(const SourceEvent& event) {
    Handover handover = delivery_.deliver({event});
    voice_.tell(handover.isWhole() ? std::string() : "the summary waits: " + delivery_.problem());
    return handover;
  }

  const Options& options_;
  Voice voice_{kName};
  Delivery delivery_;
  ResourcePeriod period_;
  State state_;
  // Handed over, and the daemon did not say that it has it: it is tried again as it is.
  std::optional<SourceEvent> begun_;
  uint64_t waits_ = 0;  // that no report has told yet
};

}  // namespace
}  // namespace kyt::sources

int main(int argc, char** argv) {
  using namespace kyt::sources;
  Options options;
  const kyt::CommandLine line(kName, "Reports how busy the machine is");
  line.option("--period", options.period, "Seconds that a report sums up").between(1, 86400).showsDefault();
  line.option("--interval", options.interval, "Seconds between two looks").between(1, 3600).showsDefault();
  options.common.addTo(line);
  line.option("--root", options.root, "A folder in front of /proc, /sys and /var");
  if (const auto status = line.parse(argc, argv)) return *status;
  Waiting waiting;
  if (!waiting.works()) return 1;
  return Resources(options).run(waiting);
}
