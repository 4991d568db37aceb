// When the outbox asks a server again: after a failure it waits, longer each time, and not before the time that the server
// has asked for, which is noted on the disk for the next process.
#include <algorithm>
#include <map>
#include <utility>

#include "outbox/Outbox.h"
#include "platform/RandomSource.h"
#include "platform/base/Limits.h"
#include "platform/queues/Log.h"

namespace kyt {
namespace {

constexpr std::chrono::milliseconds kFirstPause = std::chrono::seconds(5);
constexpr std::chrono::milliseconds kLongestPause = std::chrono::minutes(30);
constexpr unsigned kMostDoublings = 9;
// A pause is noted for a little longer than it is, so that a server that asks for one with each answer costs the disk little:
// an eighth, and no more than this.
constexpr std::chrono::seconds kMostMore{60};
constexpr int kPartMore = 8;
// The longest that is heeded, and the longest that this program notes.
constexpr std::chrono::seconds kLongestAsked = std::chrono::hours(24),
                               kLongestNoted = kLongestAsked + kMostMore;

// FNV-1a. Two servers of one number share a pause.
uint64_t numberOf(std::string_view server) {
  constexpr uint64_t kPrime = 1099511628211U;
  uint64_t number = 14695981039346656037U;
  for (const char c : server) number = (number ^ static_cast<unsigned char>(c)) * kPrime;
  return number;
}

// What is left of it. By a clock that is not set, or behind the time at which it was noted, all of it.
std::chrono::seconds restOf(const PostStore::ServerPause& pause, std::optional<int64_t> now) {
  const bool isWhole =
      pause.since > 0 && pause.until > pause.since && pause.until - pause.since <= kLongestNoted.count() + 1;
  if (!isWhole) return std::chrono::seconds(0);
  const int64_t rest = now && *now >= pause.since ? pause.until - *now : pause.until - pause.since;
  return std::min(std::chrono::seconds(rest), kLongestAsked);
}

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

// What servers have asked earlier processes for. Once more when the clock is set, and where it was behind: when it is no more,
// or has been for so long that it is believed.
void Outbox::takePauses(bool isBelieved) {
  const auto time = timeNow();
  const MonotonicTime now = ports_.clock.monotonic();
  std::map<uint64_t, ServerLine*> lines;
  for (auto& [server, line] : posts_.lines()) lines[numberOf(server)] = &line;
  std::vector<PostStore::ServerPause> over;
  for (const PostStore::ServerPause& pause : ports_.store.pauses()) {
    const auto known = lines.find(pause.server);
    const std::chrono::seconds rest = restOf(pause, time);
    const bool isOver = known == lines.end() || rest.count() <= 0;
    if (isOver) over.push_back({pause.server, 0, 0});
    if (known == lines.end() || known->second->notBefore != known->second->noted)
      continue;  // or it has asked anew
    ServerLine& line = *known->second;
    const bool isAhead = time && pause.since > *time;
    if (isAhead && isBelieved) {
      line.noted = MonotonicTime();  // noted by this clock, so that it does not begin anew each time
      continue;
    }
    if (isAhead) pausesAheadUntil_ = std::max(pausesAheadUntil_, pause.since);
    line.notBefore = line.noted = isOver ? MonotonicTime() : now + rest;
    line.nextTry = isOver ? now + pauseAfter(0) : line.notBefore;
  }
  if (!over.empty()) static_cast<void>(ports_.store.setPauses(over));
}

// What the disk does not take now it takes later: nothing waits for that.
void Outbox::notePauses() {
  const auto time = timeNow();
  const MonotonicTime now = ports_.clock.monotonic(), none{};
  if (!isLoaded_ || diskRests() || now < notingRestsUntil_) return;
  size_t known = 0;
  for (const auto& [server, line] : posts_.lines()) known += line.noted != none ? 1 : 0;
  std::vector<PostStore::ServerPause> changed;
  std::vector<std::pair<ServerLine*, MonotonicTime>> noted;
  for (auto& [server, line] : posts_.lines()) {
    if (line.posts == 0 || line.notBefore == none) {
      if (line.noted == none) continue;
      changed.push_back({numberOf(server), 0, 0});
      noted.emplace_back(&line, none);
    } else if (time && line.notBefore > std::max(now, line.noted)) {
      if (line.noted == none && ++known > Limits::maxOutboxPauses) continue;
      const Duration length = line.notBefore - now;
      noted.emplace_back(&line, line.notBefore + std::min<Duration>(length / kPartMore, kMostMore));
      const auto whole = std::chrono::ceil<std::chrono::seconds>(noted.back().second - now);
      changed.push_back({numberOf(server), *time, *time + whole.count()});
    }
  }
  if (changed.empty()) return;
  if (const auto problem = ports_.store.setPauses(changed)) {
    if (problem->kind == PostStoreProblem::Kind::damaged) return handle(*problem);
    notingRestsUntil_ = now + kDiskPause;
    if (ports_.counters.mayTell(Reason::postNotKept, problem->text, now))
      ports_.log.error("Outbox: How long servers want to be left alone cannot be noted: %s",
                       problem->text.c_str());
    return;
  }
  for (const auto& [line, until] : noted) line->noted = until;
}

// The file is another one.
void Outbox::forgetNoted() {
  for (auto& [server, line] : posts_.lines()) line.noted = MonotonicTime();
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
