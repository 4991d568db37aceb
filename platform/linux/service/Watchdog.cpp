#include "platform/linux/service/Watchdog.h"

#include <unistd.h>

#include <algorithm>
#include <charconv>
#include <chrono>
#include <cstdint>
#include <cstdlib>
#include <string_view>
#include <utility>

#include "platform/queues/SerialQueue.h"

namespace kyt {
namespace {

constexpr std::chrono::hours kLongestInterval{24 * 365};
constexpr int kSignsPerInterval = 2;
constexpr int kLeewayPart = 20;  // of the interval: how late a sign may be, to share a wake-up

std::optional<uint64_t> numberOf(std::string_view text) {
  uint64_t number = 0;
  const auto result = std::from_chars(text.data(), text.data() + text.size(), number);
  if (result.ec != std::errc() || result.ptr != text.data() + text.size()) return std::nullopt;
  return number;
}

}  // namespace

// The pool, but for the offer that somebody else runs its queues: the reactor does that with short work, and would
// prove nothing about the workers.
class Watchdog::WorkersAlone final : public Executor {
 public:
  explicit WorkersAlone(Executor& workers) : workers_(workers) {}
  void submit(std::shared_ptr<SerialQueue> queue) override { workers_.submit(std::move(queue)); }

 private:
  Executor& workers_;
};

std::optional<Duration> Watchdog::requestedInterval() {
  const char* const interval = std::getenv("WATCHDOG_USEC");
  const char* const process = std::getenv("WATCHDOG_PID");
  if (interval == nullptr || std::getenv("NOTIFY_SOCKET") == nullptr) return std::nullopt;
  if (process != nullptr && numberOf(process) != static_cast<uint64_t>(::getpid())) return std::nullopt;
  const auto microseconds = numberOf(interval);
  if (!microseconds || *microseconds == 0) return std::nullopt;
  constexpr auto longest = static_cast<uint64_t>(std::chrono::microseconds(kLongestInterval).count());
  return std::chrono::microseconds(std::min(*microseconds, longest));
}

Watchdog::Watchdog(Duration interval, TimerService& timers, Executor& workers, Task alive)
    : workers_(std::make_unique<WorkersAlone>(workers)),
      timer_(timers.every(interval / kSignsPerInterval, interval / kLeewayPart,
                          SerialQueue::create("kyt.watchdog", *workers_), std::move(alive))) {}

Watchdog::~Watchdog() = default;

}  // namespace kyt
