// The benchmarks of the whole daemon: real sockets in, real HTTP out, figures of the daemon's process as the
// kernel gives them, each beside its reference from the same run. See README.md for what each row covers.
#include <time.h>

#include <CLI/CLI.hpp>
#include <algorithm>
#include <cstdarg>
#include <cstdio>
#include <future>
#include <thread>

#include "bench/Corpus.h"
#include "bench/Peer.h"
#include "bench/Reference.h"
#include "bench/SinkServer.h"
#include "kytreporting/KYTReporting.h"
#include "tools/demo/Stage.h"

namespace kyt::bench {

namespace {

using std::chrono::milliseconds;
using Steady = std::chrono::steady_clock;
using tools::Stage;
using tools::waitUntil;

constexpr int kBatch = 50;
constexpr size_t kCorpus = 512;

double secondsSince(Steady::time_point begin) {
  return std::chrono::duration<double>(Steady::now() - begin).count();
}

void row(const std::string& what, const std::string& figure, const std::string& reference,
         const std::string& target, std::optional<bool> reached) {
  std::printf("%-58s | %-26s | %-34s | %-18s | %s\n", what.c_str(), figure.c_str(), reference.c_str(),
              target.c_str(),
              !reached   ? ""
              : *reached ? "reached"
                         : "MISSED");
  std::fflush(stdout);
}

__attribute__((format(printf, 1, 2))) std::string text(const char* format, ...) {
  char buffer[256];
  va_list arguments;
  va_start(arguments, format);
  std::vsnprintf(buffer, sizeof buffer, format, arguments);
  va_end(arguments);
  return buffer;
}

class Bench {
 public:
  Bench(std::string programs, std::string share, std::string initializesCurl)
      : programs_(std::move(programs)),
        share_(std::move(share)),
        initializesCurl_(std::move(initializesCurl)) {
    for (const Dictionary& payload : corpusPayloads(kCorpus)) {
      std::string call;
      appendEventCall(call, 1000, 7, payload);
      calls_.push_back(std::move(call));
    }
  }

  bool prepare(int eventThreshold) {
    sink_ = std::make_unique<SinkServer>(2, 200);
    Stage::Options options;
    options.programs = programs_;
    options.share = share_;
    options.internalBuild = true;
    options.consent = false;
    options.extraSettings =
        "[limits]\nmax_connections_per_user = 16384\nmax_batch_bytes = 1073741824\n"
        "max_bytes_per_user = 17179869184\nmax_descriptors_per_user = 1048576\n";
    auto made = Stage::make(std::move(options));
    if (auto* error = std::get_if<Error>(&made)) {
      std::fprintf(stderr, "bench: %s\n", error->localizedDescription.c_str());
      return false;
    }
    stage_ = std::move(std::get<std::unique_ptr<Stage>>(made));
    const std::string url = "http://127.0.0.1:" + std::to_string(sink_->port()) + "/events";
    if (stage_->putStorebag("dulvek", benchBag(url, eventThreshold))) return false;
    if (auto error = stage_->startDaemon()) {
      std::fprintf(stderr, "bench: %s\n", error->localizedDescription.c_str());
      return false;
    }
    return true;
  }

  // Sends `count` events of one client, in writes of `perWrite` calls, at `perSecond` (0: as fast as it
  // goes).
  void load(Peer& peer, size_t count, size_t perWrite, double perSecond) const {
    std::string block;
    const auto begin = Steady::now();
    for (size_t sent = 0; sent < count;) {
      block.clear();
      for (size_t i = 0; i < perWrite && sent < count; ++i, ++sent) block += calls_[sent % calls_.size()];
      if (!peer.send(block)) return;
      if (perSecond <= 0) continue;
      std::this_thread::sleep_until(
          begin + std::chrono::duration_cast<Steady::duration>(
                      std::chrono::duration<double>(static_cast<double>(sent) / perSecond)));
    }
  }

  struct Run {
    double wall = 0, processor = 0;
    uint64_t posts = 0;
    bool whole = false;
  };

  Run post(size_t clients, size_t each, size_t perWrite, double perSecondEach) {
    std::vector<Peer> peers;
    for (size_t i = 0; i < clients; ++i)
      if (auto peer = Peer::open(stage_->socketPath(), static_cast<uint32_t>(100 + i)))
        peers.push_back(std::move(*peer));
    Run run;
    if (peers.size() != clients) return run;
    const uint64_t wanted = sink_->posts() + clients * ((each - 1) / kBatch);
    const double before = figuresOf(stage_->daemon()->pid()).processorSeconds;
    const auto begin = Steady::now();
    std::vector<std::thread> threads;
    for (Peer& peer : peers)
      threads.emplace_back(
          [this, &peer, each, perWrite, perSecondEach] { load(peer, each, perWrite, perSecondEach); });
    for (std::thread& thread : threads) thread.join();
    run.whole = waitUntil(milliseconds(120000), [&] { return sink_->posts() >= wanted; });
    run.wall = secondsSince(begin);
    run.processor = figuresOf(stage_->daemon()->pid()).processorSeconds - before;
    run.posts = sink_->posts();
    return run;
  }

  void posting(size_t events) {
    if (!prepare(kBatch - 1)) return;
    (void)post(4, 2000, 20, 0);  // warm, and the reference's bodies
    const ReferenceFigures reference = measureReference(sink_->bodies());
    const double floor = reference.secondsPerRecord * 1e6;
    std::printf(
        "corpus: %zu keys, %.0f bytes of JSON a record, compressing %.2f to one; floor %.2f µs a record\n",
        reference.keysPerRecord, reference.jsonBytesPerRecord, reference.ratio, floor);
    const Run fast = post(4, events / 4, 20, 0);
    const double each = fast.processor / static_cast<double>(events) * 1e6;
    row(text("%zu events, socket to answered post, 4 clients", events),
        text("%.2f µs each, %.2f×", each, each / floor), text("writer + zlib: %.2f µs", floor),
        "at most 1.6×", fast.whole && each / floor <= 1.6);
    const double rate = static_cast<double>(events) / fast.wall;
    row("throughput of the same", text("%.0f /s", rate),
        text("on %u processors", std::thread::hardware_concurrency()), "140000 /s on 4",
        std::thread::hardware_concurrency() >= 4 ? std::optional(rate >= 140000) : std::nullopt);
    const Run quiet = post(4, 12500, 1, 1250);
    const double quietEach = quiet.processor / 50000 * 1e6;
    row("the same at a quiet 5,000 events a second",
        text("%.2f µs each, %.2f×", quietEach, quietEach / floor), text("writer + zlib: %.2f µs", floor),
        "at most 2.2×", quiet.whole && quietEach / floor <= 2.2);
  }

  // Batched events alone. Processor time is taken while batches of 400 fill, their flushes left out, so that
  // the blocks of one batch are those of the last one, as in a daemon that runs for long; memory over one
  // batch that no flush ends.
  void batching(double decodeMicroseconds) {
    if (!prepare(2000000000)) return;
    auto peer = Peer::open(stage_->socketPath(), 1);
    if (!peer) return;
    const int pid = stage_->daemon()->pid();
    constexpr size_t kEach = 400, kRounds = 500, kWarm = 50;
    double spent = 0;
    for (size_t round = 0; round < kWarm + kRounds; ++round) {
      const double before = processorSeconds(pid);
      load(*peer, kEach, 50, 0);
      if (!peer->ping()) return;
      if (round >= kWarm) spent += processorSeconds(pid) - before;
      if (!peer->flush()) return;
    }
    const double each = spent / (kEach * kRounds) * 1e6;
    row("one batched event, socket to batch, system calls included", text("%.2f µs", each),
        decodeMicroseconds > 0 ? text("decode: %.2f µs, %.2f×", decodeMicroseconds, each / decodeMicroseconds)
                               : "",
        "at most 2.5×",
        decodeMicroseconds > 0 ? std::optional(each / decodeMicroseconds <= 2.5) : std::nullopt);
    constexpr size_t kEvents = 100000;
    const ProcessFigures before = figuresOf(pid);
    load(*peer, kEvents, 50, 0);
    (void)peer->ping();
    const ProcessFigures after = figuresOf(pid);
    const double bytes = static_cast<double>(after.anonymousBytes - before.anonymousBytes) / kEvents;
    row("memory of one batched event", text("%.0f bytes", bytes), "growth of anonymous memory",
        "at most 1536", bytes <= 1536);
  }

  // What a program pays for one sendMessage with a dictionary that is ready.
  void client() {
    if (!prepare(kBatch - 1)) return;
    KYTReporting::Options options;
    options.socketPath = stage_->socketPath();
    options.sessionInfo = {{kKYTReportingSessionInfoSessionID, 9},
                           {kKYTReportingSessionInfoClientType, 8},
                           {kKYTReportingSessionInfoBatchEvent, true}};
    const auto session = KYTReporting::open(std::move(options));
    std::promise<void> configured;
    session->startConfiguration([&configured](auto, auto) { configured.set_value(); });
    configured.get_future().wait();
    const std::vector<Dictionary> payloads = corpusPayloads(kCorpus);
    std::vector<double> spent;
    uint64_t taken = 0;
    for (size_t i = 0; i < 200000; ++i) {
      const Dictionary& payload = payloads[i % payloads.size()];
      const auto begin = Steady::now();
      taken += session->sendMessage(7, 1, payload) ? 1 : 0;
      spent.push_back(secondsSince(begin) * 1e6);
      // About 100,000 a second: what the daemon takes beside it, so that the queue is not full all the time.
      while (secondsSince(begin) < 10e-6) {
      }
    }
    std::sort(spent.begin(), spent.end());
    const double median = spent[spent.size() / 2], tail = spent[spent.size() * 99 / 100];
    row("a client's sendMessage with a ready dictionary", text("median %.2f µs, 99 %% %.2f µs", median, tail),
        text("%llu of 200000 taken", static_cast<unsigned long long>(taken)), "1.5 and 5 µs",
        median <= 1.5 && tail <= 5);
    (void)session->finish();
  }

  void idle(size_t sessions) {
    if (!prepare(kBatch - 1)) return;
    const int pid = stage_->daemon()->pid();
    std::this_thread::sleep_for(std::chrono::seconds(1));
    const ProcessFigures begin = figuresOf(pid);
    std::this_thread::sleep_for(std::chrono::seconds(5));
    const ProcessFigures end = figuresOf(pid);
    row("idle daemon: wake-ups in 5 s",
        text("%llu", static_cast<unsigned long long>(end.switches - begin.switches)), "", "none",
        end.switches == begin.switches);
    row("idle daemon: anonymous memory", text("%.2f MiB", end.anonymousBytes / 1048576.0), "",
        "at most 3 MiB", end.anonymousBytes <= 3u << 20);
    row("idle daemon: resident before the first session", text("%.2f MiB", end.residentBytes / 1048576.0), "",
        "at most 9 MiB", end.residentBytes <= 9u << 20);
    {
      auto first = Peer::open(stage_->socketPath(), 1);
      if (!first) return;
      const ProcessFigures used = figuresOf(pid);
      const uint64_t curl = residentOfCurlProgram();
      row("resident after the first session", text("%.2f MiB", used.residentBytes / 1048576.0),
          text("a program that initialises libcurl: %.2f", curl / 1048576.0), "at most 3 MiB above",
          curl > 0 ? std::optional(used.residentBytes <= curl + (3u << 20)) : std::nullopt);
    }
    std::vector<Peer> peers;
    openSessions(peers, 10);
    const ProcessFigures few = figuresOf(pid);
    openSessions(peers, sessions);
    const ProcessFigures many = figuresOf(pid);
    const double growth =
        static_cast<double>(many.anonymousBytes - few.anonymousBytes) / static_cast<double>(sessions - 10);
    row(text("an idle configured session, growth over %zu", peers.size()), text("%.1f KiB", growth / 1024),
        "", "at most 24 KiB", peers.size() == sessions && growth <= 24 * 1024);
    crowd(peers);
  }

 private:
  void openSessions(std::vector<Peer>& peers, size_t wanted) const {
    while (peers.size() < wanted) {
      auto peer = Peer::open(stage_->socketPath(), static_cast<uint32_t>(peers.size()));
      if (!peer) return;
      peers.push_back(std::move(*peer));
    }
  }

  // The first ten of these sessions beside the ten of a second daemon that has no others, in turns, so that
  // whatever else the machine does meets both alike.
  void crowd(std::vector<Peer>& peers) const {
    Bench other(programs_, share_, initializesCurl_);
    if (!other.prepare(kBatch - 1)) return;
    std::vector<Peer> ten;
    other.openSessions(ten, 10);
    if (ten.size() < 10 || peers.size() < 10) return;
    // Client and daemons share one processor. Otherwise a round trip takes two or three times as long when the
    // scheduler happens to put its two threads on two, and one daemon's row may be lucky where the other's is not.
    const OneProcessor pinned({stage_->daemon()->pid(), other.stage_->daemon()->pid()});
    std::vector<double> alone, crowded;
    for (int block = 0; block < 42; ++block) {
      const bool warm = block < 2;
      other.addLatencies(ten, warm ? nullptr : &alone);
      addLatencies(peers, warm ? nullptr : &crowded);
    }
    std::sort(alone.begin(), alone.end());
    std::sort(crowded.begin(), crowded.end());
    if (alone.empty() || crowded.empty()) return;
    const double median = crowded[crowded.size() / 2], medianAlone = alone[alone.size() / 2];
    const double tail = crowded[crowded.size() * 99 / 100], tailAlone = alone[alone.size() * 99 / 100];
    row(text("%zu sessions of which 10 speak", peers.size()),
        text("median %.1f µs, 99 %% %.1f µs", median, tail),
        text("alone: %.1f µs, %.1f µs", medianAlone, tailAlone), "within 10 %",
        median <= 1.1 * medianAlone && tail <= 1.1 * tailAlone);
  }

  // An event and a ping of each of the first ten in turn: how long until it was handled, in microseconds.
  void addLatencies(std::vector<Peer>& peers, std::vector<double>* out) const {
    for (size_t round = 0; round < 500; ++round) {
      Peer& peer = peers[round % 10];
      const auto begin = Steady::now();
      if (!peer.sendAndPing(calls_[round % calls_.size()])) return;
      if (out != nullptr) out->push_back(secondsSince(begin) * 1e6);
    }
  }

  uint64_t residentOfCurlProgram() const {
    auto program = tools::ChildProcess::start(initializesCurl_, {}, {});
    if (!program) return 0;
    std::this_thread::sleep_for(milliseconds(500));
    return figuresOf(program->pid()).residentBytes;
  }

  std::string programs_, share_, initializesCurl_;
  std::vector<std::string> calls_;
  std::unique_ptr<SinkServer> sink_;
  std::unique_ptr<Stage> stage_;
};

}  // namespace

}  // namespace kyt::bench

int main(int argc, char** argv) {
  CLI::App app("Benchmarks of the whole daemon.", "kyt_bench_daemon");
  std::string programs, share;
  size_t events = 1000000, sessions = 10000;
  double decode = 0;
  std::vector<std::string> only;
  app.add_option("--programs", programs)->required();
  app.add_option("--share", share)->required();
  app.add_option("--events", events, "events of the posting rows");
  app.add_option("--sessions", sessions, "sessions of the idle rows");
  app.add_option("--decode", decode,
                 "microseconds of one decode, from kyt_bench_ipc, as the reference of batching");
  app.add_option("--only", only, "posting, batching, client, idle");
  CLI11_PARSE(app, argc, argv);
  const auto wanted = [&only](const char* name) {
    return only.empty() || std::find(only.begin(), only.end(), name) != only.end();
  };
  const std::string curl = programs + "/kyt_bench_curl_init";
  if (wanted("posting")) kyt::bench::Bench(programs, share, curl).posting(events);
  if (wanted("batching")) kyt::bench::Bench(programs, share, curl).batching(decode);
  if (wanted("client")) kyt::bench::Bench(programs, share, curl).client();
  if (wanted("idle")) kyt::bench::Bench(programs, share, curl).idle(sessions);
}
