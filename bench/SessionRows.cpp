// Rows of sessions: what they take while they rest and while they speak, and whether the many hold up the few.
#include <algorithm>
#include <chrono>
#include <thread>

#include "bench/Corpus.h"
#include "bench/Measurements.h"
#include "bench/Rows.h"

namespace kyt::bench {

namespace {

using Steady = std::chrono::steady_clock;
using std::chrono::milliseconds;

constexpr size_t kCorpus = 512;
constexpr int kBatch = 50;

double MiB(uint64_t bytes) {
  return static_cast<double>(bytes) / 1048576.0;
}

std::unique_ptr<Stand> standFor(const Surroundings& surroundings) {
  return Stand::make({surroundings.programs, surroundings.share, false, false, kBatch});
}

uint64_t residentOfCurlProgram(const Surroundings& surroundings) {
  auto program = tools::ChildProcess::start(surroundings.programs + "/kyt_bench_curl_init", {}, {});
  if (!program) return 0;
  std::this_thread::sleep_for(milliseconds(500));
  return figuresOfItAlone(program->pid()).residentBytes;
}

// An event and a ping of each of the first ten in turn: how long until it was handled, in microseconds.
void addLatencies(std::vector<Peer>& peers, const std::vector<std::string>& calls, std::vector<double>* out) {
  for (size_t round = 0; round < 500; ++round) {
    Peer& peer = peers[round % 10];
    const auto begin = Steady::now();
    if (!peer.sendAndPing(calls[round % calls.size()])) return;
    if (out != nullptr)
      out->push_back(std::chrono::duration<double, std::micro>(Steady::now() - begin).count());
  }
}

// The first ten of these sessions beside the ten of a second daemon that has no others, in turns, so that
// whatever else the machine does meets both alike.
void measureCrowd(const Surroundings& surroundings, Stand& stand, std::vector<Peer>& peers) {
  const auto other = standFor(surroundings);
  if (other == nullptr) return;
  std::vector<Peer> ten;
  other->openSessions(ten, 10);
  if (ten.size() < 10 || peers.size() < 10) return;
  const std::vector<std::string> calls = eventCalls(corpusPayloads(kCorpus));
  // Client and daemons share one processor. Otherwise a round trip takes two or three times as long when the
  // scheduler happens to put its two threads on two, and one daemon's row may be lucky where the other's is not.
  const OneProcessor pinned({stand.pid(), other->pid()});
  std::vector<double> alone, crowded;
  for (int block = 0; block < 42; ++block) {
    const bool warm = block < 2;
    addLatencies(ten, calls, warm ? nullptr : &alone);
    addLatencies(peers, calls, warm ? nullptr : &crowded);
  }
  std::sort(alone.begin(), alone.end());
  std::sort(crowded.begin(), crowded.end());
  if (alone.empty() || crowded.empty()) return;
  const double median = crowded[crowded.size() / 2], medianAlone = alone[alone.size() / 2];
  const double tail = crowded[crowded.size() * 99 / 100], tailAlone = alone[alone.size() * 99 / 100];
  printRow(rows::kCrowd, text("median %.1f µs, 99 %% %.1f µs", median, tail),
           text("%zu sessions; alone: %.1f, %.1f µs", peers.size(), medianAlone, tailAlone), "within 10 %",
           median <= 1.1 * medianAlone && tail <= 1.1 * tailAlone);
}

void measureRest(const Surroundings& surroundings, Stand& stand) {
  std::this_thread::sleep_for(std::chrono::seconds(1));
  const ProcessFigures begin = figuresOf(stand.pid());
  std::this_thread::sleep_for(std::chrono::seconds(5));
  const ProcessFigures end = figuresOf(stand.pid());
  printRow(rows::kWakeUps, text("%llu", static_cast<unsigned long long>(end.switches - begin.switches)),
           "helper processes included", "none", end.switches == begin.switches);
  const ProcessFigures alone = figuresOfItAlone(stand.pid());
  printRow(rows::kIdleAnonymous, text("%.2f MiB", MiB(alone.anonymousBytes)),
           text("with its helper processes: %.2f MiB", MiB(end.anonymousBytes)), "at most 3 MiB",
           alone.anonymousBytes <= 3u << 20);
  printRow(rows::kIdleResident, text("%.2f MiB", MiB(alone.residentBytes)),
           text("with its helper processes: %.2f MiB", MiB(end.residentBytes)), "at most 9 MiB",
           alone.residentBytes <= 9u << 20);
  auto first = Peer::open(stand.socketPath(), 1);
  if (!first) return;
  const ProcessFigures used = figuresOfItAlone(stand.pid());
  const uint64_t curl = residentOfCurlProgram(surroundings);
  printRow(rows::kAfterFirst, text("%.2f MiB", MiB(used.residentBytes)),
           text("a program that initialises libcurl: %.2f", MiB(curl)), "at most 3 MiB above",
           curl > 0 ? std::optional(used.residentBytes <= curl + (3u << 20)) : std::nullopt);
}

}  // namespace

// A thousand sessions whose batches fill at the same pace, so that just before they are posted all are as large as they
// become.
void measureBusy(const Surroundings& surroundings) {
  const auto stand = standFor(surroundings);
  if (stand == nullptr) return;
  const std::vector<std::string> calls = eventCalls(ordinaryPayloads(kCorpus));
  constexpr size_t kSessions = 1000;
  {
    std::vector<Peer> first;
    stand->openSessions(first, 1);
  }
  const uint64_t before = figuresOf(stand->pid()).residentBytes;
  const Stand::Run run =
      stand->post(calls, {.clients = kSessions, .threads = 4, .each = 4 * kBatch, .perWrite = 1});
  const uint64_t most = figuresOfItAlone(stand->pid()).mostResidentBytes;
  printRow(
      rows::kBusy, text("%.1f MiB at most", MiB(most)),
      text("with helper processes: %.1f MiB", MiB(run.mostResident)) + (run.whole ? "" : ", NOT ALL ARRIVED"),
      "below 40 MiB", run.whole && most < 40u << 20);
  printRow(rows::kBusyEach,
           text("%.1f KiB", static_cast<double>(run.mostResident - before) / 1024 / kSessions), "", "",
           std::nullopt);
}

void measureIdle(const Surroundings& surroundings) {
  const auto stand = standFor(surroundings);
  if (stand == nullptr) return;
  measureRest(surroundings, *stand);
  std::vector<Peer> peers;
  stand->openSessions(peers, 10);
  const ProcessFigures few = figuresOf(stand->pid());
  stand->openSessions(peers, surroundings.sizes.sessions);
  const ProcessFigures many = figuresOf(stand->pid());
  const double growth = static_cast<double>(many.anonymousBytes - few.anonymousBytes) /
                        static_cast<double>(surroundings.sizes.sessions - 10);
  printRow(rows::kIdleSession, text("%.1f KiB", growth / 1024), text("over %zu", peers.size()),
           "at most 24 KiB", peers.size() == surroundings.sizes.sessions && growth <= 24 * 1024);
  measureCrowd(surroundings, *stand, peers);
}

// Each session is told before the daemon ends, and has something to post.
void measureEnd(const Surroundings& surroundings) {
  const auto stand = standFor(surroundings);
  if (stand == nullptr) return;
  const std::vector<std::string> calls = eventCalls(ordinaryPayloads(kCorpus));
  const size_t wanted = surroundings.sizes.sessions + surroundings.sizes.sessions / 2;
  std::vector<Peer> peers;
  stand->openSessions(peers, wanted);
  for (size_t i = 0; i < peers.size(); ++i)
    if (!peers[i].sendAndPing(calls[i % calls.size()])) return;
  const std::optional<double> seconds = stand->end();
  const uint64_t posts = stand->sink().posts();
  printRow(rows::kEnd, seconds ? text("%.2f s", *seconds) : "NOT ENDED",
           text("%zu sessions, of which %llu posted", peers.size(), static_cast<unsigned long long>(posts)),
           "within the grace time, 5 s",
           seconds && *seconds <= 5 && peers.size() == wanted && posts == wanted);
}

}  // namespace kyt::bench
