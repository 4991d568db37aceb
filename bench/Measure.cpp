#include "bench/Measure.h"

#include <time.h>

#include <CLI/CLI.hpp>
#include <algorithm>
#include <cmath>
#include <cstdio>
#include <deque>
#include <optional>
#include <thread>

namespace kyt::bench {

namespace {

constexpr uint64_t kMostRounds = 1000000000;

double secondsOf(clockid_t clock) {
  timespec time{};
  clock_gettime(clock, &time);
  return static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_nsec) / 1e9;
}

std::vector<Piece>& pieces() {
  static std::vector<Piece> all;
  return all;
}

// As many threads as the piece wants, each with rounds of its own.
std::deque<Rounds> runOnce(const Piece& piece, uint64_t count, size_t argument) {
  std::deque<Rounds> all;
  for (size_t i = 0; i < piece.threads; ++i) all.emplace_back(count, argument);
  if (all.size() == 1) {
    piece.run(all.front());
    return all;
  }
  std::vector<std::thread> threads;
  for (Rounds& rounds : all) threads.emplace_back([&piece, &rounds] { piece.run(rounds); });
  for (std::thread& thread : threads) thread.join();
  return all;
}

double longestOf(const std::deque<Rounds>& all) {
  double longest = 0;
  for (const Rounds& rounds : all) longest = std::max(longest, rounds.spent().wall);
  return longest;
}

void print(const std::string& name, const std::deque<Rounds>& all) {
  Spent spent;
  uint64_t items = 0;
  for (const Rounds& rounds : all) {
    spent += rounds.spent();
    items += rounds.items();
  }
  const double count = static_cast<double>(all.front().count()) * static_cast<double>(all.size());
  std::printf("%-40s %12.1f ns %12.1f ns %12.0f", name.c_str(), spent.wall / count * 1e9,
              spent.processor / count * 1e9, count);
  if (items > 0) std::printf(" item=%.1f ns", spent.processor / static_cast<double>(items) * 1e9);
  for (const auto& [what, value] : all.front().figures()) std::printf(" %s=%g", what.c_str(), value);
  std::printf("\n");
  std::fflush(stdout);
}

bool runPiece(const Piece& piece, double seconds) {
  for (const size_t argument : piece.arguments) {
    std::string name = piece.name;
    if (argument != 0) name += "/" + std::to_string(argument);
    if (piece.threads > 1) name += "/threads:" + std::to_string(piece.threads);
    for (uint64_t count = 1;;) {
      const std::deque<Rounds> all = runOnce(piece, count, argument);
      if (!all.front().failure().empty()) {
        std::fprintf(stderr, "%s: %s\n", name.c_str(), all.front().failure().c_str());
        return false;
      }
      const double spent = longestOf(all);
      if (spent >= seconds || count >= kMostRounds) {
        print(name, all);
        break;
      }
      // A little more than should be enough; at most ten times as many, since a short run says little.
      const double wanted = std::clamp(seconds * 1.4 / std::max(spent, 1e-9), 1.5, 10.0);
      count = std::min(kMostRounds, static_cast<uint64_t>(std::ceil(static_cast<double>(count) * wanted)));
    }
  }
  return true;
}

}  // namespace

Spent Spent::now() {
  return {secondsOf(CLOCK_MONOTONIC), secondsOf(CLOCK_THREAD_CPUTIME_ID)};
}

Spent& Spent::operator+=(const Spent& other) {
  wall += other.wall;
  processor += other.processor;
  return *this;
}

void Rounds::begin() {
  begun_ = true;
  begin_ = Spent::now();
}

bool Rounds::end() {
  spent_ = Spent::now() - begin_;
  return false;
}

void Rounds::goOn() {
  begin_ += Spent::now() - paused_;
}

bool addPiece(Piece piece) {
  pieces().push_back(std::move(piece));
  return true;
}

int runPieces(int argc, char** argv) {
  CLI::App app("Benchmarks of single pieces.");
  double seconds = 0.5;
  std::string only;
  app.add_option("--seconds", seconds, "how long each takes at least");
  app.add_option("--only", only, "those whose name has this text in it");
  CLI11_PARSE(app, argc, argv);
#ifndef NDEBUG
  std::printf("built for debugging: the figures say nothing\n");
#endif
  std::printf("%-40s %15s %15s %12s\n", "", "time", "processor", "rounds");
  bool good = true;
  for (const Piece& piece : pieces())
    if (piece.name.find(only) != std::string::npos) good = runPiece(piece, seconds) && good;
  return good ? 0 : 1;
}

}  // namespace kyt::bench
