// The benchmarks of the whole daemon: real sockets in, real HTTP out, figures of the daemon's processes as the
// kernel gives them, each beside its reference from the same run. See README.md for what each row covers.
#include <CLI/CLI.hpp>
#include <algorithm>
#include <cstdio>
#include <string>
#include <utility>
#include <vector>

#include "bench/Measurements.h"
#include "bench/Rows.h"

int main(int argc, char** argv) {
  using namespace kyt::bench;
  const std::vector<std::pair<std::string, void (*)(const Surroundings&)>> groups = {
      {"posting", measurePosting}, {"fields", measureFields}, {"quiet", measureQuiet},
      {"tls", measureTLS},         {"busy", measureBusy},     {"batching", measureBatching},
      {"client", measureClient},   {"idle", measureIdle},     {"end", measureEnd},
      {"beside", measureBeside}};
  std::vector<std::string> names;
  for (const auto& group : groups) names.push_back(group.first);
  CLI::App app("Benchmarks of the whole daemon.", "kyt_bench_daemon");
  Surroundings surroundings;
  std::vector<std::string> only;
  bool list = false;
  app.add_option("--programs", surroundings.programs, "folder of the built programs");
  app.add_option("--share", surroundings.share, "folder of the bundles: packaging/share");
  app.add_option("--events", surroundings.sizes.events, "events of a posting row; the other rows' follow")
      ->check(CLI::Range(size_t{2400}, size_t{1000000000}));
  app.add_option("--sessions", surroundings.sizes.sessions, "sessions of the idle rows")
      ->check(CLI::Range(size_t{11}, size_t{16000}));
  app.add_option("--quiet-seconds", surroundings.sizes.quietSeconds, "how long a quiet row takes");
  app.add_option("--decode", surroundings.decodeMicroseconds,
                 "microseconds of one decode, from kyt_bench_ipc, as the reference of batching");
  app.add_option("--only", only, "some groups of rows")->check(CLI::IsMember(names));
  app.add_flag("--list", list, "the rows with their groups, without measuring");
  CLI11_PARSE(app, argc, argv);
  if (list) {
    for (const RowName& row : allRows()) std::printf("%-9s| %s\n", row.group.c_str(), row.what.c_str());
    return 0;
  }
  for (const auto& [name, measure] : groups)
    if (only.empty() || std::find(only.begin(), only.end(), name) != only.end()) measure(surroundings);
}
