// The groups of rows of kyt_bench_daemon: each makes its daemons, measures, and prints its rows (Rows.h). README.md says
// how each row is measured.
#pragma once

#include <cstddef>
#include <string>

#include "bench/Stand.h"

namespace kyt::bench {

struct Sizes {
  size_t events = 600000;  // of a posting row; the other rows' follow from it
  size_t sessions = 10000;
  double quietSeconds = 5;
};

struct Surroundings {
  std::string programs, share;
  Sizes sizes;
  double decodeMicroseconds = 0;  // of one call, from kyt_bench_ipc; 0: not known
};

void measurePosting(const Surroundings& surroundings);
void measureFields(const Surroundings& surroundings);
void measureQuiet(const Surroundings& surroundings);
void measureTLS(const Surroundings& surroundings);
void measureBusy(const Surroundings& surroundings);
void measureBatching(const Surroundings& surroundings);
void measureClient(const Surroundings& surroundings);
void measureIdle(const Surroundings& surroundings);
void measureEnd(const Surroundings& surroundings);
void measureBeside(const Surroundings& surroundings);

}  // namespace kyt::bench
