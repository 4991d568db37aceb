// How far a source has reported: a file of two or three lines, replaced as a whole, so that a crash at any point leaves the old
// one or the new one. One thread.
#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>

namespace kyt::sources {

struct State {
  // Of the next report. One that is made again has the number of the first. The first number of all is that of the day (UTC)
  // on which the state was made, by its first second since 1970: reports are at least a second apart, so what is numbered
  // anew after the loss of a state has other numbers, from the next day on. A day is too long to tell devices apart by it.
  uint64_t report = 1;
  // Where the journal was read to: a cursor, or "@" and microseconds since 1970 before anything was found.
  std::string position;
  // Where the journal was read to when that report was handed over and not taken whole, likewise; else empty.
  std::string until;
  friend bool operator==(const State&, const State&) = default;
};

// The state of the file, or of a source that begins. `problem` says what is there in the place of a state, or is left alone.
[[nodiscard]] State stateAtStart(const std::string& path, std::chrono::seconds since1970,
                                 std::string& problem);
// None: there is no such file yet, or it holds nothing that a source wrote.
[[nodiscard]] std::optional<State> readState(const std::string& path);
// Why it could not be written. Its folder is there.
[[nodiscard]] std::optional<std::string> writeState(const std::string& path, const State& state);

}  // namespace kyt::sources
