#include "platform/queues/LineLimits.h"

#include <chrono>

#include "platform/base/Limits.h"
#include "platform/queues/Log.h"
#include "platform/queues/SerialQueue.h"

namespace kyt {
namespace {

constexpr Duration kWindow = std::chrono::seconds(1);
thread_local std::optional<uint32_t> currentUser;

}  // namespace

ClientScope::ClientScope(std::optional<uint32_t> user) : before_(currentUser) {
  currentUser = user;
}

ClientScope::~ClientScope() {
  currentUser = before_;
}

std::optional<uint32_t> ClientScope::user() {
  return currentUser;
}

LineLimits::LineLimits(Log& log, Clock& clock, TimerService& timers, std::shared_ptr<SerialQueue> queue,
                       uint64_t most)
    : log_(log), clock_(clock), timers_(timers), queue_(std::move(queue)), most_(most) {
  log_.setLineLimits(this);
}

LineLimits::~LineLimits() {
  finish();
}

bool LineLimits::admits(uint32_t user, const char* format) {
  const MonotonicTime now = clock_.monotonic();
  const MutexLock lock(mutex_);
  if (finished_) return true;
  Lines& lines = lines_[{user, format}];
  // A window that has left lines out ends when that is told.
  if (lines.leftOut == 0 && now >= lines.since + kWindow) lines = {now};
  if (lines.written < most_) {
    ++lines.written;
    return true;
  }
  ++lines.leftOut;
  if (!std::exchange(telling_, true)) timer_ = timers_.after(kWindow, queue_, [this] { tell(); });
  return false;
}

void LineLimits::tell() {
  std::vector<std::pair<Key, uint64_t>> leftOut;
  {
    const MutexLock lock(mutex_);
    telling_ = false;
    for (const auto& [key, lines] : lines_)
      if (lines.leftOut != 0) leftOut.emplace_back(key, lines.leftOut);
    lines_.clear();
  }
  for (const auto& [key, count] : leftOut)
    log_.normal("Log(write): %llu lines of clients of user %u left out, of this kind: %s",
                static_cast<unsigned long long>(count), key.first, key.second);
}

void LineLimits::finish() {
  TimerHandle timer;
  {
    const MutexLock lock(mutex_);
    if (std::exchange(finished_, true)) return;
    timer = std::move(timer_);
  }
  timer.cancel();
  log_.setLineLimits(nullptr);
  tell();
}

}  // namespace kyt
