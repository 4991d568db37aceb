// A block that the program gave and that may run often. It is kept aside while it runs: the program may close the session
// from inside, which drops it. The library's thread, or where nothing runs for the session there, the thread that opens or
// closes it.
#pragma once

#include <utility>

#include "platform/base/Function.h"

namespace kyt::client {

template <typename... Arguments>
class ProgramBlock {
 public:
  using Block = Function<void(Arguments...)>;

  explicit ProgramBlock(Block block) : block_(std::move(block)) {}
  ProgramBlock(const ProgramBlock&) = delete;
  ProgramBlock& operator=(const ProgramBlock&) = delete;

  // Whether run() would run it: not while it runs, not once it was dropped, not if the program gave none.
  [[nodiscard]] bool isReady() const { return static_cast<bool>(block_); }
  void run(Arguments... arguments) {
    if (!block_) return;
    Block running = std::exchange(block_, nullptr);
    running(std::forward<Arguments>(arguments)...);
    if (!dropped_) block_ = std::move(running);
  }
  // It never runs again, and what it holds is freed, once it has returned.
  void drop() {
    dropped_ = true;
    block_.reset();
  }

 private:
  Block block_;
  bool dropped_ = false;
};

}  // namespace kyt::client
