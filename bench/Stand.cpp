#include "bench/Stand.h"

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <thread>
#include <utility>
#include <variant>

#include "bench/Corpus.h"

namespace kyt::bench {

namespace {

using Steady = std::chrono::steady_clock;

constexpr uint16_t kCategory = 7;

Steady::duration seconds(double count) {
  return std::chrono::duration_cast<Steady::duration>(std::chrono::duration<double>(count));
}

std::unique_ptr<Stand> failed(const std::string& why) {
  std::fprintf(stderr, "bench: %s\n", why.c_str());
  return nullptr;
}

// What one thread sends for its clients, in turn.
void speak(std::vector<Peer*> peers, const std::vector<std::string>& calls, const Stand::Load& load,
           Steady::time_point begin) {
  std::string block;
  for (size_t sent = 0; sent < load.each;) {
    const size_t count = std::min(load.perWrite, load.each - sent);
    for (Peer* peer : peers) {
      block.clear();
      for (size_t i = 0; i < count; ++i) block += calls[(sent + i) % calls.size()];
      if (!peer->send(block)) return;
    }
    sent += count;
    if (load.perSecond > 0)
      std::this_thread::sleep_until(begin + seconds(static_cast<double>(sent) / load.perSecond));
  }
}

}  // namespace

std::vector<std::string> eventCalls(const std::vector<Dictionary>& payloads) {
  std::vector<std::string> calls;
  for (const Dictionary& payload : payloads) appendEventCall(calls.emplace_back(), 1000, kCategory, payload);
  return calls;
}

std::unique_ptr<Stand> Stand::make(const Options& options) {
  std::unique_ptr<Stand> stand(new Stand);
  stand->batch_ = options.batch;
  tools::Stage::Options stage;
  stage.programs = options.programs;
  stage.share = options.share;
  stage.internalBuild = true;
  stage.consent = options.consent;
  stage.extraSettings =
      "[limits]\nmax_connections_per_user = 16384\nmax_batch_bytes = 1073741824\n"
      "max_bytes_per_user = 17179869184\nmax_descriptors_per_user = 1048576\n" +
      options.settings;
  auto made = tools::Stage::make(std::move(stage));
  if (auto* error = std::get_if<Error>(&made)) return failed(error->localizedDescription);
  stand->stage_ = std::move(std::get<std::unique_ptr<tools::Stage>>(made));
  const std::string keys = stand->stage_->folder() + "/server/server";
  if (options.tls && !stand->sink_.addTLS(keys + ".pem", keys + "-key.pem"))
    return failed("the sink cannot use the development server's certificate");
  const std::string host = options.tls ? "https://127.0.0.1:" + std::to_string(stand->sink_.portWithTLS())
                                       : "http://127.0.0.1:" + std::to_string(stand->sink_.port());
  const Dictionary bag = benchBag(host + "/events", options.batch - 1, options.consent);
  if (auto error = stand->stage_->putStorebag("dulvek", bag)) return failed(error->localizedDescription);
  if (auto error = stand->stage_->startDaemon()) return failed(error->localizedDescription);
  return stand;
}

void Stand::send(Peer& peer, const std::vector<std::string>& calls, size_t count, size_t perWrite) {
  Load load;
  load.each = count;
  load.perWrite = perWrite;
  speak({&peer}, calls, load, {});
}

void Stand::openSessions(std::vector<Peer>& peers, size_t wanted) const {
  while (peers.size() < wanted) {
    auto peer = Peer::open(stage_->socketPath(), static_cast<uint32_t>(peers.size() + 1));
    if (!peer) return;
    peers.push_back(std::move(*peer));
  }
}

Stand::Run Stand::post(const std::vector<std::string>& calls, const Load& load) {
  std::vector<Peer> peers;
  openSessions(peers, load.clients);
  Run run;
  if (peers.size() != load.clients) return run;
  const size_t threads = load.threads == 0 ? load.clients : load.threads;
  const auto batch = static_cast<size_t>(batch_);
  const uint64_t posts = sink_.posts() + load.clients * ((load.each + batch - 1) / batch);
  const uint64_t bytes = sink_.bodyBytes();
  const double processor = processorSeconds(pid());
  const auto begin = Steady::now();
  std::vector<std::thread> speakers;
  for (size_t i = 0; i < threads; ++i) {
    speakers.emplace_back([&, i] {
      std::vector<Peer*> own;
      for (size_t peer = i; peer < peers.size(); peer += threads) own.push_back(&peers[peer]);
      // The clients of a steady load are out of step with each other.
      const auto start =
          load.perSecond > 0
              ? begin + seconds(static_cast<double>(i) / load.perSecond / static_cast<double>(threads))
              : begin;
      std::this_thread::sleep_until(start);
      speak(own, calls, load, start);
      // Of each the last batch, full or not.
      for (Peer* peer : own) static_cast<void>(peer->flush());
    });
  }
  for (std::thread& speaker : speakers) speaker.join();
  run.whole = tools::waitUntil(std::chrono::milliseconds(120000), [&] { return sink_.posts() >= posts; });
  run.wall = std::chrono::duration<double>(Steady::now() - begin).count();
  const ProcessFigures figures = figuresOf(pid());
  run.processor = figures.processorSeconds - processor;
  run.mostResident = figures.mostResidentBytes;
  run.bodyBytes = static_cast<double>(sink_.bodyBytes() - bytes);
  run.events = load.clients * load.each;
  return run;
}

std::optional<double> Stand::end() {
  const auto begin = Steady::now();
  if (stage_->stopDaemon(std::chrono::minutes(1)) != 0) return std::nullopt;
  return std::chrono::duration<double>(Steady::now() - begin).count();
}

}  // namespace kyt::bench
