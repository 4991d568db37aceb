// Hands one report to the daemon: a session of its own for each, so that a source holds no connection in between and the
// daemon may end when it is idle. One thread; blocks.
#pragma once

#include <chrono>
#include <string>
#include <vector>

#include "sources/Summary.h"

namespace kyt::sources {

class Delivery {
 public:
  struct Options {
    std::string socket;  // empty: as the client library finds it
    std::string client;  // "ClientName", the program's own name
    uint8_t clientType = 0;
    std::chrono::milliseconds patience = std::chrono::seconds(30);  // for all of one report
  };
  explicit Delivery(Options options) : options_(std::move(options)) {}
  // Which of the events the daemon has taken. What it does with them (the owner's consent, filters, the network) is its
  // own, and in its books.
  [[nodiscard]] std::vector<bool> deliver(const std::vector<SourceEvent>& events);
  // Why the last report was not taken whole; empty: it was.
  [[nodiscard]] const std::string& problem() const { return problem_; }

 private:
  const Options options_;
  std::string problem_;
};

}  // namespace kyt::sources
