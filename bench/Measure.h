// Repeats a piece of code until its time says something, and prints the time of one repetition. The project's own, since
// the benchmark library of the distribution is built for debugging. A program of such pieces links kyt_bench_measure,
// which has its main(); `--seconds S` says how long each piece takes at least, `--only TEXT` which run.
//
//   void copyRecord(Rounds& rounds) {
//     const Dictionary record = makeRecord();
//     while (rounds.more()) keep(Dictionary(record));
//   }
//   KYT_MEASURE(copyRecord);
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <string>
#include <utility>
#include <vector>

namespace kyt::bench {

// Lets the compiler believe that the value is read and written.
template <typename T>
inline void keep(T&& value) {
  asm volatile("" : : "g"(&value) : "memory");
}

struct Spent {
  double wall = 0, processor = 0;  // seconds; the latter of the calling thread
  Spent operator-(const Spent& other) const { return {wall - other.wall, processor - other.processor}; }
  Spent& operator+=(const Spent& other);
  [[nodiscard]] static Spent now();
};

// What a piece gets: how often to repeat. One thread.
class Rounds {
 public:
  Rounds(uint64_t count, size_t argument) : left_(count), count_(count), argument_(argument) {}
  // True as often as is asked for; time is taken from the first call to the one that returns false.
  [[nodiscard]] bool more() {
    if (left_ == count_ && !begun_) begin();
    if (left_ == 0) return end();
    --left_;
    return true;
  }
  // What stands between does not count.
  void pause() { paused_ = Spent::now(); }
  void goOn();
  // One of the numbers that the piece was registered with.
  [[nodiscard]] size_t argument() const { return argument_; }
  [[nodiscard]] uint64_t count() const { return count_; }
  // Further columns: how many pieces of work were done in all, of which the time is told too; a figure of its own.
  void setItems(uint64_t items) { items_ = items; }
  void addFigure(std::string name, double value) { figures_.emplace_back(std::move(name), value); }
  // The piece cannot be measured; the program ends with 1.
  void fail(std::string why) { failure_ = std::move(why); }

  [[nodiscard]] const Spent& spent() const { return spent_; }
  [[nodiscard]] uint64_t items() const { return items_; }
  [[nodiscard]] const std::string& failure() const { return failure_; }
  [[nodiscard]] const std::vector<std::pair<std::string, double>>& figures() const { return figures_; }

 private:
  void begin();
  bool end();
  uint64_t left_, items_ = 0;
  const uint64_t count_;
  const size_t argument_;
  bool begun_ = false;
  Spent begin_, paused_, spent_;
  std::string failure_;
  std::vector<std::pair<std::string, double>> figures_;
};

struct Piece {
  std::string name;
  std::function<void(Rounds&)> run;
  std::vector<size_t> arguments = {0};  // a row for each
  size_t threads = 1;                   // that run it at the same time
};
// Returns true, so that a variable can be made of it.
bool addPiece(Piece piece);
// Each piece that is registered, one after the other. The status of the program.
[[nodiscard]] int runPieces(int argc, char** argv);

}  // namespace kyt::bench

// Registers a function void(Rounds&); further members of Piece may follow.
#define KYT_MEASURE_JOIN(a, b) a##b
#define KYT_MEASURE_NAME(line) KYT_MEASURE_JOIN(kPieceOfLine, line)
#define KYT_MEASURE(function, ...)                                \
  [[maybe_unused]] static const bool KYT_MEASURE_NAME(__LINE__) = \
      ::kyt::bench::addPiece(::kyt::bench::Piece{#function, function __VA_OPT__(, ) __VA_ARGS__})
