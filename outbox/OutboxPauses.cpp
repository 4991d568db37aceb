// When the outbox asks a server again: after a failure it waits, longer each time, and not before the time that the server
// has asked for.
#include <algorithm>
#include <utility>

#include "outbox/Outbox.h"
#include "platform/RandomSource.h"

namespace kyt {
namespace {

constexpr std::chrono::milliseconds kFirstPause = std::chrono::seconds(5);
constexpr std::chrono::milliseconds kLongestPause = std::chrono::minutes(30);
constexpr unsigned kMostDoublings = 9;

}  // namespace

// A random time up to a limit that doubles with each failure: devices that failed together do not come back together.
Duration Outbox::pauseAfter(unsigned failures) {
  const auto most = std::min(kFirstPause * (1U << std::min(failures, kMostDoublings)), kLongestPause);
  return std::chrono::milliseconds(ports_.random.uniform(static_cast<uint32_t>(most.count()) + 1));
}

void Outbox::fail(ServerLine& line, std::optional<Duration> length, bool isUnanswered) {
  const MonotonicTime now = ports_.clock.monotonic();
  line.isOpen = false;
  line.isUnreachable = isUnanswered;
  if (std::exchange(line.isHastened, false)) ++line.hastened;
  const Duration random = pauseAfter(line.failures);
  // Several that were on their way failed together: that is one failure.
  const bool isAnother = line.failures == 0 || now >= line.nextTry;
  if (isAnother) {
    ++line.failures;
    setNextTry(line, now + random);
  }
  if (length) pause(line, *length);
}

void Outbox::pause(ServerLine& line, Duration length) {
  line.notBefore = std::max(line.notBefore, ports_.clock.monotonic() + length);
  line.nextTry = std::max(line.nextTry, line.notBefore);
}

void Outbox::setNextTry(ServerLine& line, MonotonicTime time) {
  line.nextTry = std::max(time, line.notBefore);
}

// There is reason to try before the time has come.
bool Outbox::hasten(ServerLine& line, Duration sinceLastTry) {
  const MonotonicTime soonest =
      std::max({ports_.clock.monotonic(), line.lastTry + sinceLastTry, line.notBefore});
  if (line.nextTry <= soonest) return false;
  line.nextTry = soonest;
  return true;
}

// A server that takes new posts and goes on failing what is left here is asked less and less often too.
void Outbox::hearGood(ServerLine& line) {
  takes(line);
  const Duration pause =
      std::min<Duration>(kBetweenTries * (1U << std::min(line.hastened, kMostDoublings)), kLongestPause);
  line.isHastened = hasten(line, pause) || line.isHastened;
}

}  // namespace kyt
