// Rows of events that are posted: what they cost the daemon's processes, and how many it takes.
#include <algorithm>
#include <cmath>

#include "bench/Corpus.h"
#include "bench/Measurements.h"
#include "bench/Reference.h"
#include "bench/Rows.h"

namespace kyt::bench {

namespace {

constexpr size_t kCorpus = 512;
// What is told apart from its reference at most: consent off, as packaged.
constexpr double kMostOfFloor = 1.35;
// Older goals, whose floor has zlib in it: random digits.
constexpr double kMostOfZlib = 1.6, kMostOfZlibAtRest = 2.2;

std::unique_ptr<Stand> standFor(const Surroundings& surroundings, bool consent, int batch, bool tls = false) {
  return Stand::make({surroundings.programs, surroundings.share, consent, tls, batch});
}

std::vector<std::string> callsOf(const Posting& posting) {
  return eventCalls(posting.ordinary ? ordinaryPayloads(kCorpus) : corpusPayloads(kCorpus));
}

// The first posts load libraries and fill caches.
void warm(Stand& stand, const std::vector<std::string>& calls, size_t each) {
  static_cast<void>(stand.post(calls, {.clients = 1, .each = each}));
}

// A small run, which tells whether the rows work, takes its time neither.
ReferenceFigures referenceOf(Stand& stand, const Surroundings& surroundings) {
  return measureReference(stand.sink().bodies(), surroundings.sizes.events < 100000 ? 0.01 : 0.7);
}

std::string figureOf(const Stand::Run& run, double floor) {
  return text("%.2f µs each, %.2f×", run.microseconds(), run.microseconds() / floor);
}

std::string floorText(const ReferenceFigures& reference) {
  return text("own writer + %s: %.2f µs, zlib: %.2f", reference.compressor.c_str(),
              reference.secondsPerRecord * 1e6, reference.secondsWithZlib * 1e6);
}

struct Goal {
  std::string text;
  double most = 0;  // microseconds; 0: none
};
Goal goalOf(const Posting& posting, const ReferenceFigures& reference) {
  if (posting.consent) return {};
  if (posting.ordinary && posting.clients == 1)
    return {text("at most %.2f×", kMostOfFloor), kMostOfFloor * reference.secondsPerRecord * 1e6};
  if (!posting.ordinary && posting.clients == 4)
    return {text("at most %.1f× zlib", kMostOfZlib), kMostOfZlib * reference.secondsWithZlib * 1e6};
  return {};
}

std::string wholeText(const Stand::Run& run) {
  return run.whole ? "" : ", NOT ALL ARRIVED";
}

}  // namespace

void measurePosting(const Surroundings& surroundings) {
  for (const Posting& posting : postingRows()) {
    const auto stand = standFor(surroundings, posting.consent, posting.batch);
    if (stand == nullptr) continue;
    const std::vector<std::string> calls = callsOf(posting);
    warm(*stand, calls, static_cast<size_t>(posting.batch) * 4);
    const Stand::Run run =
        stand->post(calls, {.clients = posting.clients, .each = surroundings.sizes.events / posting.clients});
    const ReferenceFigures reference = referenceOf(*stand, surroundings);
    const double floor = reference.secondsPerRecord * 1e6;
    const Goal goal = goalOf(posting, reference);
    printRow("processor time: " + posting.name(), figureOf(run, floor), floorText(reference), goal.text,
             goal.most > 0 ? std::optional(run.whole && run.microseconds() <= goal.most) : std::nullopt);
    printRow(
        "rate, memory: " + posting.name(),
        text("%.0f /s, %.1f MiB at most", run.rate(), static_cast<double>(run.mostResident) / 1048576.0) +
            wholeText(run),
        text("%zu keys, %.0f bytes, posted as %.1f", reference.keysPerRecord, reference.jsonBytesPerRecord,
             run.bytesEach()),
        "", std::nullopt);
  }
}

void measureFields(const Surroundings& surroundings) {
  for (const size_t fields : fieldRows()) {
    const auto stand = standFor(surroundings, false, 1000);
    if (stand == nullptr) continue;
    const std::vector<std::string> calls = eventCalls(ordinaryPayloads(kCorpus, fields));
    warm(*stand, calls, 2000);
    const size_t events = surroundings.sizes.events / (fields >= 50 ? fields / 10 : 1);
    const Stand::Run run = stand->post(calls, {.clients = 1, .each = events});
    const ReferenceFigures reference = referenceOf(*stand, surroundings);
    const double most = fields == 50 ? 35 : fields == 200 ? 110 : 0;
    printRow(nameOfFields(fields), figureOf(run, reference.secondsPerRecord * 1e6) + wholeText(run),
             floorText(reference), most > 0 ? text("at most %.0f µs", most) : "",
             most > 0 ? std::optional(run.whole && run.microseconds() <= most) : std::nullopt);
  }
}

void measureQuiet(const Surroundings& surroundings) {
  for (const Posting& posting : quietRows()) {
    const auto stand = standFor(surroundings, posting.consent, posting.batch);
    if (stand == nullptr) continue;
    const std::vector<std::string> calls = callsOf(posting);
    warm(*stand, calls, static_cast<size_t>(posting.batch) * 4);
    const auto each = static_cast<size_t>(std::ceil(1250 * surroundings.sizes.quietSeconds));
    const Stand::Run run =
        stand->post(calls, {.clients = posting.clients, .each = each, .perWrite = 1, .perSecond = 1250});
    const ReferenceFigures reference = referenceOf(*stand, surroundings);
    const double floor = reference.secondsPerRecord * 1e6;
    const double most = posting.ordinary ? 0 : kMostOfZlibAtRest * reference.secondsWithZlib * 1e6;
    printRow("5,000 a second: " + posting.name(), figureOf(run, floor) + wholeText(run), floorText(reference),
             most > 0 ? text("at most %.1f× zlib", kMostOfZlibAtRest) : "",
             most > 0 ? std::optional(run.whole && run.microseconds() <= most) : std::nullopt);
  }
}

void measureTLS(const Surroundings& surroundings) {
  for (const Crowd& crowd : tlsRows()) {
    const auto batch = static_cast<size_t>(crowd.batch);
    const std::vector<std::string> calls = eventCalls(ordinaryPayloads(kCorpus));
    // At least one whole batch of each.
    const size_t each = std::max(surroundings.sizes.events / crowd.sessions / batch, size_t{1}) * batch;
    Stand::Run run[2];
    for (const bool tls : {false, true}) {
      const auto stand = standFor(surroundings, false, crowd.batch, tls);
      if (stand == nullptr) return;
      warm(*stand, calls, batch);
      run[tls ? 1 : 0] = stand->post(calls, {.clients = crowd.sessions, .threads = 4, .each = each});
    }
    const double ratio = run[1].microseconds() / run[0].microseconds();
    const double most = crowd.sessions == 64 ? 1.15 : 1.4;
    printRow(
        crowd.name(),
        text("%.2f µs each, %.2f×, %.0f /s", run[1].microseconds(), ratio, run[1].rate()) + wholeText(run[1]),
        text("without: %.2f µs, %.0f /s", run[0].microseconds(), run[0].rate()) + wholeText(run[0]),
        text("at most %.2f×", most), run[0].whole && run[1].whole && ratio <= most);
  }
}

}  // namespace kyt::bench
