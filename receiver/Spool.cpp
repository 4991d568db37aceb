#include "receiver/Spool.h"

#include <algorithm>
#include <utility>

#include "platform/linux/base/Threads.h"
#include "receiver/Limits.h"

namespace kyt::receiver {
namespace {

uint64_t bytesOf(const LogMessage& message) {
  uint64_t bytes = message.id.size() + message.body.size();
  for (const auto& [name, value] : message.headers) bytes += name.size() + value.size();
  return bytes;
}

}  // namespace

Spool::Spool(PostStore& store, uint64_t maxBytes, const Clock& clock, Figures& figures, Log& lines,
             uint32_t partitions, std::function<std::optional<std::string>()> prepare,
             std::function<bool()> isOurs)
    : store_(store),
      maxBytes_(maxBytes),
      clock_(clock),
      figures_(figures),
      lines_(lines),
      lanes_(partitions),
      prepare_(std::move(prepare)),
      isOurs_(std::move(isOurs)) {}

Spool::~Spool() {
  stop();
}

void Spool::start(Replays& replays) {
  thread_ = std::thread([this, &replays] { run(replays); });
}

void Spool::stop() {
  {
    MutexLock lock(mutex_);
    isStopping_ = true;
    changed_.notifyAll();
  }
  if (thread_.joinable()) thread_.join();
}

void Spool::add(std::shared_ptr<const LogMessage> message, std::function<void(SpoolVerdict)> done) {
  auto adding = std::make_shared<Adding>();
  adding->bytes = bytesOf(*message);
  if ((bytes_ += adding->bytes) > maxBytes_) {
    bytes_ -= adding->bytes;
    return done(SpoolVerdict::full);
  }
  adding->message = std::move(message);
  adding->done = std::move(done);
  adding->since = clock_.monotonic();
  MutexLock lock(mutex_);
  added_.push_back(adding);
  waiting_.push_back(std::move(adding));
  changed_.notifyOne();
}

void Spool::replayed(int64_t number, SpoolReplay result) {
  MutexLock lock(mutex_);
  replies_.emplace_back(number, result);
  changed_.notifyOne();
}

void Spool::wake() {
  MutexLock lock(mutex_);
  isWoken_ = true;
  changed_.notifyOne();
}

void Spool::tick() {
  std::vector<std::function<void(SpoolVerdict)>> late;
  {
    const MonotonicTime now = clock_.monotonic();
    MutexLock lock(mutex_);
    while (!waiting_.empty() && waiting_.front()->since + Limits::spoolTime <= now) {
      late.push_back(std::exchange(waiting_.front()->done, {}));
      waiting_.pop_front();
    }
  }
  for (const auto& done : late) done(SpoolVerdict::broken);
}

bool Spool::mayKeep() const {
  return !isBroken() || (isOpen_ && failedAt_.load() + Limits::brokenTime <= clock_.monotonic());
}

uint64_t Spool::oldestSeconds() const {
  const int64_t oldest = oldest_.load();
  return oldest == 0 ? 0 : static_cast<uint64_t>(std::max<int64_t>(clock_.timeOfDay().seconds - oldest, 1));
}

void Spool::run(Replays& replays) {
  beginServiceThread("kyt-spool");
  for (;;) {
    const auto due = turn(replays);
    MutexLock lock(mutex_);
    if (!added_.empty() || !replies_.empty() || isWoken_) continue;
    if (isStopping_) return;
    if (due)
      changed_.waitUntil(mutex_, *due);
    else
      changed_.wait(mutex_);
  }
}

Spool::Additions Spool::takeAdditions() {
  Additions taken;
  size_t bytes = 0;
  MutexLock lock(mutex_);
  while (!added_.empty() && taken.size() < Limits::maxSpoolChangePosts &&
         bytes < Limits::maxSpoolChangeBytes) {
    bytes += added_.front()->bytes;
    taken.push_back(std::move(added_.front()));
    added_.pop_front();
  }
  return taken;
}

// Those that have not been told by tick(), which they were when their time was over.
void Spool::tell(const Additions& added, SpoolVerdict verdict) {
  std::vector<std::function<void(SpoolVerdict)>> told;
  uint64_t bytes = 0;
  {
    MutexLock lock(mutex_);
    for (const auto& adding : added) {
      bytes += adding->bytes;
      if (adding->done) told.push_back(std::exchange(adding->done, {}));
    }
    while (!waiting_.empty() && !waiting_.front()->done) waiting_.pop_front();
  }
  if (verdict != SpoolVerdict::kept) bytes_ -= bytes;
  for (const auto& done : told) done(verdict);
}

void Spool::showFigures() {
  posts_ = entries_.size() + stuckPosts_;
  oldest_ = entries_.empty() ? 0 : entries_.begin()->second.keptAt;
  for (Lane& lane : lanes_)
    lane.isReplayable = !lane.isUnread && (!lane.waiting.empty() || lane.inFlight != 0);
}

std::optional<MonotonicTime> Spool::turn(Replays& replays) {
  lookForFolder();
  if (!isOpen_ && clock_.monotonic() >= nextOpening_) open();
  takeReplies();
  const Additions added = takeAdditions();
  const bool hadEntries = !entries_.empty();
  const bool isDone = change(added);
  showFigures();
  if (!added.empty()) tell(added, isDone ? SpoolVerdict::kept : SpoolVerdict::broken);
  const bool isEmpty = entries_.size() == toRemove_.size() && stuckPosts_ == 0;
  if (hadEntries && isEmpty && !isLost_) {
    // On a full disk nothing can be removed row by row; the whole file can.
    store_.becameEmpty();
    if (isDone) lines_.normal("spool: it is empty");
  }
  const MonotonicTime now = clock_.monotonic();
  const bool takesReplays = replays.takesReplays();
  if (takesReplays) replayMore(replays, now);
  showFigures();
  return nextTurn(now, takesReplays);
}

}  // namespace kyt::receiver
