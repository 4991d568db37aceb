// How a program's main thread sleeps until it is to end: SIGTERM and SIGINT, or a request from inside. Made
// before any other thread exists, so that no thread of the program takes these signals by their default.
// SIGPIPE is ignored from then on: a write to a closed socket is an error like any other.
#pragma once

#include "platform/ipc/ClientSessionInterface.h"

namespace kyt {

class StopSignals {
 public:
  StopSignals();
  StopSignals(const StopSignals&) = delete;
  StopSignals& operator=(const StopSignals&) = delete;

  // Blocks. The signal's number, or 0 after request(). Also when it came before the call.
  [[nodiscard]] int wait();
  // Any thread, never blocks.
  void request();

 private:
  Descriptor signals_, requests_;
};

}  // namespace kyt
