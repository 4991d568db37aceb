// Rows of what one thing more costs: two daemons of which one has it, loaded in turn.
#include <signal.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <fstream>
#include <optional>
#include <sstream>

#include "bench/Corpus.h"
#include "bench/Measurements.h"
#include "bench/Rows.h"
#include "tools/demo/ChildProcess.h"

namespace kyt::bench {

namespace {

constexpr size_t kCorpus = 512;
constexpr int kBatch = 1000;
constexpr double kMost = 1.02;

std::unique_ptr<Stand> standFor(const Surroundings& surroundings, const std::string& settings) {
  return Stand::make({surroundings.programs, surroundings.share, true, false, kBatch, settings});
}

// The median of the pairs is what counts: a spell of other work on the machine falls on few of them.
void measurePairs(const char* what, Stand& with, Stand& without, const Surroundings& surroundings) {
  const std::vector<std::string> calls = eventCalls(ordinaryPayloads(kCorpus));
  const Stand::Load load{.clients = 1, .each = std::max(surroundings.sizes.events / 4, size_t{kBatch})};
  const size_t pairs = surroundings.sizes.events < 100000 ? 2 : 30;
  std::vector<double> ratios, bare;
  bool whole = true;
  for (Stand* stand : {&with, &without})
    whole &= stand->post(calls, {.clients = 1, .each = 4 * kBatch}).whole;
  for (size_t i = 0; i < pairs; ++i) {
    // Whoever comes first in a pair comes second in the next.
    Stand* const order[] = {i % 2 == 0 ? &with : &without, i % 2 == 0 ? &without : &with};
    Stand::Run runs[2];
    for (Stand* stand : order) runs[stand == &with ? 0 : 1] = stand->post(calls, load);
    whole &= runs[0].whole && runs[1].whole;
    bare.push_back(runs[1].microseconds());
    ratios.push_back(runs[0].microseconds() / runs[1].microseconds());
  }
  std::sort(ratios.begin(), ratios.end());
  std::sort(bare.begin(), bare.end());
  const double median = (ratios[(pairs - 1) / 2] + ratios[pairs / 2]) / 2;
  printRow(what,
           text("%.3f×, quartiles %.3f, %.3f", median, ratios[pairs / 4], ratios[pairs - 1 - pairs / 4]) +
               (whole ? "" : ", NOT ALL ARRIVED"),
           text("without: %.2f µs each, %zu pairs", bare[pairs / 2], pairs), text("at most %.2f×", kMost),
           whole && median <= kMost);
}

// `kytctl watch`, stopped once it watches; none: it did not come so far.
std::optional<tools::ChildProcess> startDeafWatcher(Stand& stand, const Surroundings& surroundings) {
  const std::string output = stand.folder() + "/watch.txt";
  tools::ChildProcess::Options how;
  how.outputFile = output;
  auto watcher =
      tools::ChildProcess::start(surroundings.programs + "/kytctl", {"--root", stand.folder(), "watch"}, how);
  const bool watches = watcher && tools::waitUntil(std::chrono::seconds(10), [&output] {
                         std::ostringstream shown;
                         shown << std::ifstream(output).rdbuf();
                         return shown.str().find("FATE") != std::string::npos;
                       });
  if (!watches) return std::nullopt;
  watcher->signal(SIGSTOP);
  return watcher;
}

}  // namespace

void measureBeside(const Surroundings& surroundings) {
  const auto bare = standFor(surroundings, "");
  const auto keeping = standFor(surroundings, "[outbox]\nenabled = true\n");
  if (bare == nullptr || keeping == nullptr) return;
  measurePairs(rows::kOutboxOn, *keeping, *bare, surroundings);
  const auto watched = standFor(surroundings, "");
  if (watched == nullptr) return;
  auto watcher = startDeafWatcher(*watched, surroundings);
  if (!watcher) return static_cast<void>(std::fprintf(stderr, "kytctl watch came not so far as to watch\n"));
  measurePairs(rows::kDeafWatcher, *watched, *bare, surroundings);
  watcher->signal(SIGCONT);
}

}  // namespace kyt::bench
