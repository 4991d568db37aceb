// What a receiver counts, as its metrics show it. Any thread; every number only grows, but for the gauges, which are read
// where they are known.
#pragma once

#include <array>
#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>

namespace kyt::receiver {

// Why a post was not taken. The words of the metrics, the log and the documents are in refusalName().
enum class Refusal : uint8_t {
  unknownPath,
  wrongMethod,
  ambiguous,
  noLength,
  empty,
  tooLarge,
  tooLargeForLog,
  logLimitUnknown,
  wrongEncoding,
  notGzip,
  notJSON,
  digestMissing,
  digestUnknownSender,
  digestWrong,
  tooSlow,
  cutOff,
  bodiesFull,
  spoolFull,
  spoolBroken,
  stopping,
  numberOfRefusals
};
[[nodiscard]] const char* refusalName(Refusal refusal);

// How long the log took to acknowledge, in seconds.
class Histogram {
 public:
  static constexpr std::array kBounds = {0.001, 0.0025, 0.005, 0.01, 0.025, 0.05, 0.1, 0.25, 0.5, 1.0, 2.5};
  void add(std::chrono::nanoseconds time);
  // Of those up to that bound; the last is all.
  [[nodiscard]] uint64_t upTo(size_t bound) const;
  [[nodiscard]] double sum() const { return static_cast<double>(nanoseconds_.load(relaxed)) * 1e-9; }

 private:
  static constexpr auto relaxed = std::memory_order_relaxed;
  std::array<std::atomic<uint64_t>, kBounds.size() + 1> counts_{};
  std::atomic<uint64_t> nanoseconds_{0};
};

struct Figures {
  using Number = std::atomic<uint64_t>;
  // Posts answered 200, by who has them; duplicates are among those that are stored.
  Number stored{0}, spooled{0}, duplicates{0};
  Number bodyBytes{0};  // of posts that were taken
  Number digestsValid{0}, digestsAbsent{0};
  std::array<Number, static_cast<size_t>(Refusal::numberOfRefusals)> refused{};
  // The log: messages without an answer in time, answers that refuse one now, for want of room, or for good.
  Number logTimeouts{0}, logRefusals{0}, logRefusalsFull{0}, logRefusalsForGood{0};
  Histogram publishTime;
  // The spool: posts that the log has from it, those that the log never takes or the disk no longer
  // gives, and failed changes of the file or readings of a post.
  Number replayed{0}, stuck{0}, spoolFailures{0};
  Number deadLetters{0}, deadLettersLeftOut{0};

  void refuse(Refusal refusal) {
    refused.at(static_cast<size_t>(refusal)).fetch_add(1, std::memory_order_relaxed);
  }
};

inline void count(Figures::Number& number, uint64_t by = 1) {
  number.fetch_add(by, std::memory_order_relaxed);
}

}  // namespace kyt::receiver
