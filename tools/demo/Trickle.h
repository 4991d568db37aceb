// The demonstration's clients go on: one process for each, a session that lasts, and now and then an event of it. One
// thread.
#pragma once

#include <chrono>
#include <optional>
#include <random>
#include <string>
#include <vector>

#include "platform/base/Descriptor.h"
#include "tools/demo/ChildProcess.h"

namespace kyt::tools {

class Stage;

class Trickle {
 public:
  // Of that stage's clients, whose daemon runs. A text when one cannot be started.
  [[nodiscard]] std::optional<std::string> start(Stage& stage);
  // The next event, of any of the clients; every few of them a flush.
  void step();
  // Until then.
  [[nodiscard]] std::chrono::milliseconds pause();
  // The sessions say goodbye; waits for their processes, some seconds.
  void finish();

 private:
  struct Client {
    ChildProcess process;
    Descriptor steps;  // what it does next
    int sent = 0;
  };
  static void tell(const Client& client, const std::string& step);
  int number(int from, int to) { return std::uniform_int_distribution<int>(from, to)(random_); }

  std::vector<Client> clients_;
  std::mt19937 random_;  // what it draws need not differ
};

}  // namespace kyt::tools
