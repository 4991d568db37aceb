// The spool's way to the log, partition by partition.
#include <algorithm>
#include <utility>

#include "receiver/Limits.h"
#include "receiver/Spool.h"

namespace kyt::receiver {

void Spool::takeReplies() {
  std::vector<std::pair<int64_t, SpoolReplay>> replies;
  bool isWoken = false;
  {
    MutexLock lock(mutex_);
    replies.swap(replies_);
    isWoken = std::exchange(isWoken_, false);
  }
  for (const auto& [number, result] : replies) {
    const auto known = entries_.find(number);
    if (known == entries_.end() || known->second.state != Entry::State::inFlight) continue;
    Entry& entry = known->second;
    Lane& lane = lanes_[entry.partition];
    --inFlight_;
    --lane.inFlight;
    inFlightBytes_ -= entry.bytes;
    lane.inFlightBytes -= entry.bytes;
    switch (result) {
      case SpoolReplay::stored:
        entry.state = Entry::State::stored;
        toRemove_.push_back(number);
        lane.isFailing = false;
        lane.window = std::min(2 * lane.window, Limits::maxReplayPosts);
        count(figures_.replayed);
        break;
      case SpoolReplay::failed:
        entry.state = Entry::State::waiting;
        lane.waiting.insert(number);
        fail(lane);
        break;
      case SpoolReplay::never:  // it was answered as taken, so it stays for a person to look at
        setStuck(number);
        break;
    }
  }
  if (isWoken)
    for (Lane& lane : lanes_) lane.nextReplay = {}, lane.cursor = 0;
}

// The oldest is tried once more; as long as that fails too, one after another: it may be the post, not the partition.
void Spool::fail(Lane& lane) {
  if (!std::exchange(lane.isFailing, true)) lane.cursor = 0;
  lane.window = 1;
  lane.nextReplay = clock_.monotonic() + Limits::replayPause;
}

// Partitions that fail get half of it all at most, so the others always go on.
bool Spool::hasRoomFor(const Lane& lane) const {
  if (inFlight_ >= Limits::maxReplayPosts || inFlightBytes_ >= Limits::maxReplayBytes) return false;
  if (!lane.isFailing) return true;
  size_t posts = 0, bytes = 0;
  for (const Lane& other : lanes_) {
    if (!other.isFailing) continue;
    posts += other.inFlight;
    bytes += other.inFlightBytes;
  }
  return posts < Limits::maxReplayPosts / 2 && bytes < Limits::maxReplayBytes / 2;
}

// False: that partition is given nothing more for now.
bool Spool::replayNext(Lane& lane, Replays& replays, MonotonicTime now) {
  if (lane.waiting.empty() || lane.inFlight >= lane.window || now < lane.nextReplay || !hasRoomFor(lane))
    return false;
  auto next = lane.waiting.upper_bound(lane.cursor);
  if (next == lane.waiting.end()) next = lane.waiting.begin();
  const int64_t number = *next;
  lane.cursor = number;
  const auto message = read(number, lane);
  if (!message) return !lane.isUnread;
  lane.waiting.erase(number);
  Entry& entry = entries_.at(number);
  entry.state = Entry::State::inFlight;
  ++inFlight_;
  ++lane.inFlight;
  inFlightBytes_ += entry.bytes;
  lane.inFlightBytes += entry.bytes;
  replays.replay(number, message);
  return true;
}

// One of each partition in turn.
void Spool::replayMore(Replays& replays, MonotonicTime now) {
  const size_t lanes = lanes_.size();
  for (size_t idle = 0; idle < lanes; nextLane_ = (nextLane_ + 1) % lanes)
    idle = replayNext(lanes_[nextLane_], replays, now) ? 0 : idle + 1;
}

// When a pause ends. What waits for room goes on with a reply.
std::optional<MonotonicTime> Spool::nextTurn(MonotonicTime now, bool takesReplays) const {
  std::optional<MonotonicTime> due;
  if (!toRemove_.empty()) due = now + Limits::replayPause;
  if (!isOpen_) due = nextOpening_;
  if (isLost_ && entries_.empty()) due = now;
  if (!takesReplays) return due;
  for (const Lane& lane : lanes_)
    if (!lane.waiting.empty() && lane.inFlight < lane.window && now < lane.nextReplay)
      due = due ? std::min(*due, lane.nextReplay) : lane.nextReplay;
  return due;
}

}  // namespace kyt::receiver
