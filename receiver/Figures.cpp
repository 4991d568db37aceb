#include "receiver/Figures.h"

namespace kyt::receiver {

const char* refusalName(Refusal refusal) {
  static constexpr std::array<const char*, static_cast<size_t>(Refusal::numberOfRefusals)> kNames = {
      "unknown-path",
      "wrong-method",
      "ambiguous",
      "no-length",
      "empty",
      "too-large",
      "too-large-for-log",
      "log-limit-unknown",
      "wrong-encoding",
      "not-gzip",
      "not-json",
      "digest-missing",
      "digest-unknown-sender",
      "digest-wrong",
      "too-slow",
      "cut-off",
      "bodies-full",
      "spool-full",
      "spool-broken",
      "stopping"};
  static_assert(kNames.back() != nullptr, "a name for each");
  return kNames.at(static_cast<size_t>(refusal));
}

void Histogram::add(std::chrono::nanoseconds time) {
  const double seconds = std::chrono::duration<double>(time).count();
  size_t bound = 0;
  while (bound < kBounds.size() && seconds > kBounds.at(bound)) ++bound;
  counts_.at(bound).fetch_add(1, relaxed);
  nanoseconds_.fetch_add(static_cast<uint64_t>(time.count()), relaxed);
}

uint64_t Histogram::upTo(size_t bound) const {
  uint64_t sum = 0;
  for (size_t i = 0; i <= bound; ++i) sum += counts_.at(i).load(relaxed);
  return sum;
}

}  // namespace kyt::receiver
