// How far a connection's life has come. It only goes forward, whoever moves it: what asks for a stage that is passed
// changes nothing. Any thread.
#pragma once

#include <atomic>
#include <cstdint>
#include <optional>

namespace kyt {

enum class Life : uint8_t {
  offered,       // the delegate has not decided yet
  shakingHands,  // it reads the client's handshake
  open,          // it reads and handles calls
  finishing,     // it reads no more, but handles what it has read
  stopping,      // it handles no more calls: its end is on the way to its queue
  ended,         // its handlers have run; at most its output is still written
  closed         // nothing touches the socket any more
};

class ConnectionLife {
 public:
  [[nodiscard]] bool reached(Life stage) const { return life_.load() >= stage; }

  // Returns the stage that was left, or nothing where this one, or a later one, was reached before: so of several who
  // ask for a stage one is told that it brought it about.
  std::optional<Life> advance(Life to) {
    Life before = life_.load();
    while (before < to) {
      if (life_.compare_exchange_weak(before, to)) return before;
    }
    return std::nullopt;
  }

 private:
  std::atomic<Life> life_{Life::offered};
};

}  // namespace kyt
