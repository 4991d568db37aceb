// How a program's main thread sleeps until it is to end: SIGTERM and SIGINT, or a request from inside. Made
// before any other thread exists, so that no thread of the program takes these signals by their default.
//
// From then on no other signal from outside ends the program, but for SIGKILL and the signals that ask for a core: SIGHUP is
// told, the others are ignored. SIGPIPE among them: a write to a closed socket is an error like any other.
#pragma once

#include <chrono>

#include "platform/base/Descriptor.h"

namespace kyt {

class StopSignals {
 public:
  StopSignals();
  StopSignals(const StopSignals&) = delete;
  StopSignals& operator=(const StopSignals&) = delete;

  // errno, when the system refused what this needs: then the signals never come, and the program must not go on.
  [[nodiscard]] int error() const { return error_; }
  // Blocks. The number of the signal that came (SIGTERM, SIGINT or SIGHUP), or 0 after request(). Also when it came
  // before the call.
  [[nodiscard]] int wait();
  // Never blocks: whether wait() would return because the program is to end. It still does.
  [[nodiscard]] bool isEndAsked();
  // Any thread, never blocks.
  void request();

 private:
  // 0: none.
  [[nodiscard]] int next() const;

  Descriptor signals_, requests_;
  int error_ = 0;
  int ended_ = 0;              // a signal that was seen, and not told yet
  bool isHangUpSeen_ = false;  // as well
};

// The process ends after so long with that status, whatever its threads wait for by then: with a line if standard error
// takes one, and nothing destroyed. The main thread's, once, after a signal to end.
void endProcessAtTheLatest(std::chrono::seconds after, int status);

}  // namespace kyt
