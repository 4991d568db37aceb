// Hands one report to the daemon: a session of its own for each, so that a source holds no connection in between and the
// daemon may end when it is idle. One thread; blocks.
//
// Where the daemon has no storebag for the client type (a device that starts before its network does) it would drop what it
// is given: nothing is handed over then. Without the owner's consent it drops as well, but that is silence for good: it
// counts as taken.
#pragma once

#include <chrono>
#include <string>
#include <vector>

#include "sources/Summary.h"

namespace kyt::sources {

// What became of a report.
struct Handover {
  bool offered = false;  // false: the daemon was given nothing of it
  // Of each event whether the daemon says that it has it. One that was offered, and is not taken, it may have as well.
  std::vector<bool> taken;
  [[nodiscard]] bool isWhole() const;
};

class Delivery {
 public:
  struct Options {
    std::string socket;  // empty: as the client library finds it
    std::string client;  // "ClientName", the program's own name
    uint8_t clientType = 0;
    // For all of one report, the goodbye included.
    std::chrono::milliseconds patience = std::chrono::seconds(30);
  };
  explicit Delivery(Options options) : options_(std::move(options)) {}
  // What the daemon does with what it has taken (the owner's consent, filters, the network) is its own, and in its books.
  [[nodiscard]] Handover deliver(const std::vector<SourceEvent>& events);
  // Why the last report was not taken whole; empty: it was.
  [[nodiscard]] const std::string& problem() const { return problem_; }

 private:
  const Options options_;
  std::string problem_;
};

}  // namespace kyt::sources
