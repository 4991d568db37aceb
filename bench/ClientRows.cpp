// Rows of one event's way into a batch, and of what a program pays to send it.
#include <chrono>
#include <future>
#include <thread>

#include "bench/CallTimes.h"
#include "bench/Corpus.h"
#include "bench/Measurements.h"
#include "bench/Rows.h"
#include "kytreporting/KYTReporting.h"

namespace kyt::bench {

namespace {

using Steady = std::chrono::steady_clock;

constexpr size_t kCorpus = 512;
constexpr int kNoFlush = 2000000000;
constexpr char kLibraryThread[] = "kytreporting";

std::unique_ptr<KYTReporting> openSession(const Stand& stand) {
  KYTReporting::Options options;
  options.socketPath = stand.socketPath();
  options.sessionInfo = {{kKYTReportingSessionInfoSessionID, 9},
                         {kKYTReportingSessionInfoClientType, 8},
                         {kKYTReportingSessionInfoBatchEvent, true}};
  auto session = KYTReporting::open(std::move(options));
  std::promise<void> configured;
  session->startConfiguration([&configured](auto, auto) { configured.set_value(); });
  configured.get_future().wait();
  return session;
}

// About 100,000 a second: what the daemon takes beside it, so that the queue is not full all the time.
void measureSend(KYTReporting& session, const std::vector<Dictionary>& payloads, size_t calls) {
  CallTimes times;
  for (size_t i = 0; i < calls; ++i) {
    const Dictionary& payload = payloads[i % payloads.size()];
    const auto begin = Steady::now();
    static_cast<void>(times.time([&] { return session.sendMessage(7, 1, payload); }));
    while (Steady::now() - begin < std::chrono::microseconds(10)) {
    }
  }
  const double median = times.most(0.5), tail = times.most(0.99);
  printRow(rows::kSend, text("median %.2f µs, 99 %% %.2f µs", median, tail),
           text("%zu accepted, %zu refused", times.accepted(), times.refused()), "1.5 and 5 µs",
           times.accepted() > 0 ? std::optional(median <= 1.5 && tail <= 5) : std::nullopt);
}

// A program that makes an event's dictionary and sends it, as fast as the daemon takes them.
void measureProgram(KYTReporting& session, size_t events) {
  const std::vector<Dictionary> payloads = ordinaryPayloads(kCorpus);
  const double program = secondsOfThisThread(), library = secondsOfOwnThreads(kLibraryThread);
  size_t refused = 0;
  for (size_t i = 0; i < events; ++i) {
    Dictionary payload;
    payload.reserve(payloads[0].size());
    for (const DictionaryEntry& entry : payloads[i % payloads.size()]) payload.append(entry.key, entry.value);
    while (!session.sendMessage(7, 1, payload)) {
      ++refused;
      std::this_thread::sleep_for(std::chrono::microseconds(300));
    }
  }
  const double ownSeconds = secondsOfThisThread() - program;
  const double librarySeconds = secondsOfOwnThreads(kLibraryThread) - library;
  const double each = (ownSeconds + librarySeconds) / static_cast<double>(events) * 1e6;
  printRow(
      rows::kClient, text("%.2f µs each", each),
      text("thread %.2f µs, %zu waits for room", librarySeconds / static_cast<double>(events) * 1e6, refused),
      "at most 1.2 µs", each <= 1.2);
}

}  // namespace

// Batched events alone. Processor time is taken while batches of 400 fill, their flushes left out, so that
// the blocks of one batch are those of the last one, as in a daemon that runs for long; memory over one
// batch that no flush ends.
void measureBatching(const Surroundings& surroundings) {
  const auto stand = Stand::make({surroundings.programs, surroundings.share, false, false, kNoFlush});
  if (stand == nullptr) return;
  auto peer = Peer::open(stand->socketPath(), 1);
  if (!peer) return;
  const std::vector<std::string> calls = eventCalls(corpusPayloads(kCorpus));
  constexpr size_t kEach = 400, kWarm = 50;
  const size_t rounds = surroundings.sizes.events / 1200;
  double spent = 0;
  for (size_t round = 0; round < kWarm + rounds; ++round) {
    const double before = processorSeconds(stand->pid());
    Stand::send(*peer, calls, kEach, 50);
    if (!peer->ping()) return;
    if (round >= kWarm) spent += processorSeconds(stand->pid()) - before;
    if (!peer->flush()) return;
  }
  const double each = spent / static_cast<double>(kEach * rounds) * 1e6;
  const double decode = surroundings.decodeMicroseconds;
  printRow(rows::kBatched, text("%.2f µs", each),
           decode > 0 ? text("decode: %.2f µs, %.2f×", decode, each / decode) : "", "at most 2.5×",
           decode > 0 ? std::optional(each / decode <= 2.5) : std::nullopt);
  const size_t events = surroundings.sizes.events / 6;
  const ProcessFigures before = figuresOf(stand->pid());
  Stand::send(*peer, calls, events, 50);
  if (!peer->ping()) return;
  const ProcessFigures after = figuresOf(stand->pid());
  const double bytes =
      static_cast<double>(after.anonymousBytes - before.anonymousBytes) / static_cast<double>(events);
  printRow(rows::kBatchedMemory, text("%.0f bytes", bytes), "growth of anonymous memory", "at most 1536",
           bytes <= 1536);
}

void measureClient(const Surroundings& surroundings) {
  const auto stand = Stand::make({surroundings.programs, surroundings.share, false, false, 1000});
  if (stand == nullptr) return;
  {
    const auto session = openSession(*stand);
    measureSend(*session, corpusPayloads(kCorpus), surroundings.sizes.events / 3);
    static_cast<void>(session->finish());
  }
  const auto session = openSession(*stand);
  measureProgram(*session, surroundings.sizes.events);
  static_cast<void>(session->finish());
}

}  // namespace kyt::bench
