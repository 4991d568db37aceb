// Lines for a descriptor whose reader (of a pipe, of a socket of datagrams) may be slow, or read no more without
// closing: whoever writes never waits. A line is written at once where there is room for it; otherwise it waits in a
// bounded queue, which a thread ("kyt-log") writes out while somebody reads. What finds no room there is dropped and
// counted, and a line tells how many when there is room again. Any thread.
#pragma once

#include <functional>
#include <memory>
#include <string>

#include "platform/base/Clock.h"

namespace kyt {

struct LineWriterOptions {
  size_t maxQueuedBytes = 1u << 20;
  // Told once for each line that is dropped. Any thread.
  std::function<void()> dropped;
  // The line that tells how many were, its end included.
  std::function<std::string(unsigned long long)> lineAboutDropped;
  // Each line is one message of a socket of datagrams, which must not block.
  bool datagrams = false;
  // Told of a line that cannot be written, and not because of room, with errno as it was. True: it is tried once more,
  // and told of as the last time when that fails too. While it runs no other line is written. Null: such a line is lost.
  std::function<bool(const std::string&, bool lastTime)> refused;
  // Kept as long as the descriptor may be used, by the thread too.
  std::shared_ptr<const void> keepsDescriptor;
};

class LineWriter {
 public:
  // The caller keeps the descriptor, and keeps it open; but see above.
  LineWriter(int descriptor, LineWriterOptions options);
  ~LineWriter();  // waits for what is queued, a second at most
  LineWriter(const LineWriter&) = delete;
  LineWriter& operator=(const LineWriter&) = delete;

  void write(std::string line);  // with its end
  // Until this is called no thread is made: what waits is written with the next line for which there is room.
  void allowThread();

 private:
  struct State;
  std::shared_ptr<State> state_;  // the thread's too: it may still wait for a reader when this has ended
};

}  // namespace kyt
