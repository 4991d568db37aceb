#include "receiver/Spool.h"

#include <algorithm>
#include <utility>

#include "platform/linux/base/Threads.h"
#include "receiver/Limits.h"

namespace kyt::receiver {
namespace {

StoredPost storedPostOf(const LogMessage& message, int64_t number, int64_t now) {
  StoredPost post;
  post.number = number;
  post.keptAt = now;
  post.url = message.id;
  post.headers = message.headers;
  post.body = Data(std::string_view(message.body));
  return post;
}

uint64_t bytesOf(const LogMessage& message) {
  uint64_t bytes = message.id.size() + message.body.size();
  for (const auto& [name, value] : message.headers) bytes += name.size() + value.size();
  return bytes;
}

}  // namespace

Spool::Spool(PostStore& store, uint64_t maxBytes, const Clock& clock, Figures& figures, Log& lines,
             uint32_t partitions)
    : store_(store),
      maxBytes_(maxBytes),
      clock_(clock),
      figures_(figures),
      lines_(lines),
      lanes_(partitions) {}

Spool::~Spool() {
  stop();
}

std::optional<std::string> Spool::open() {
  for (bool again : {true, false}) {
    const auto wrong = store_.open([this](StoredPostHead head) {
      if (head.isUnreadable) return count(figures_.stuck);
      enter(head.post.number, {head.bytes, head.post.keptAt, partitionOf(head.post.url, partitions())});
      lastNumber_ = std::max(lastNumber_, head.post.number);
      bytes_ += head.bytes;
    });
    if (!wrong) break;
    if (wrong->kind != PostStoreProblem::Kind::damaged || !again) return wrong->text;
    forgetAll();
    lines_.error("spool: %s; %s", wrong->text.c_str(), store_.setAside().c_str());
  }
  if (!entries_.empty())
    lines_.normal("spool: %zu posts of %llu bytes are left from before", entries_.size(),
                  static_cast<unsigned long long>(bytes_.load()));
  showFigures();
  return std::nullopt;
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

void Spool::enter(int64_t number, Entry entry) {
  lanes_[entry.partition].waiting.insert(number);
  entries_[number] = entry;
}

// The oldest is tried once more; as long as that fails too, one after another: it may be the post, not the partition.
void Spool::fail(Lane& lane) {
  if (!std::exchange(lane.isFailing, true)) lane.cursor = 0;
  lane.window = 1;
  lane.nextReplay = clock_.monotonic() + Limits::replayPause;
}

void Spool::setStuck(int64_t number) {
  const auto known = entries_.find(number);
  ++stuckPosts_;
  stuckBytes_ += known->second.bytes;
  lanes_[known->second.partition].waiting.erase(number);
  entries_.erase(known);
  count(figures_.stuck);
}

void Spool::forgetAll() {
  for (const auto& [number, entry] : entries_) bytes_ -= entry.bytes;
  bytes_ -= std::exchange(stuckBytes_, 0);
  stuckPosts_ = 0;
  entries_.clear();
  toRemove_.clear();
  inFlight_ = inFlightBytes_ = 0;
  for (Lane& lane : lanes_) {
    lane.waiting.clear();
    lane.inFlight = lane.inFlightBytes = 0;
  }
}

// One change of the file: what was added, what the log has. False: nothing of it was done.
bool Spool::change(const Additions& added) {
  if (added.empty() && toRemove_.empty()) return true;
  const int64_t now = clock_.timeOfDay().seconds;
  std::vector<StoredPost> posts;
  std::vector<const StoredPost*> pointers;
  posts.reserve(added.size());
  for (const auto& adding : added)
    posts.push_back(
        storedPostOf(*adding->message, lastNumber_ + 1 + static_cast<int64_t>(posts.size()), now));
  pointers.reserve(posts.size());
  for (const StoredPost& post : posts) pointers.push_back(&post);
  const auto wrong = store_.change(pointers, toRemove_, false);
  if (wrong) {
    count(figures_.spoolFailures);
    if (!isBroken_.exchange(true)) lines_.error("spool: %s", wrong->text.c_str());
    if (wrong->kind == PostStoreProblem::Kind::damaged) {
      lines_.error("spool: its posts are out of reach; %s", store_.setAside().c_str());
      forgetAll();
    }
    return false;
  }
  if (isBroken_.exchange(false)) lines_.normal("spool: it can be written to again");
  for (const auto& adding : added)
    enter(++lastNumber_, {adding->bytes, now, partitionOf(adding->message->id, partitions())});
  forget(std::exchange(toRemove_, {}));
  return true;
}

void Spool::forget(const std::vector<int64_t>& removed) {
  for (const int64_t number : removed) {
    const auto known = entries_.find(number);
    if (known == entries_.end()) continue;
    bytes_ -= known->second.bytes;
    entries_.erase(known);
  }
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

// None: that one is stuck, or the disk gives it another time. Either way those behind it go on.
std::shared_ptr<const LogMessage> Spool::read(int64_t number, Lane& lane) {
  auto read = store_.read(number);
  const auto* wrong = std::get_if<PostStoreProblem>(&read);
  lane.isUnread = wrong != nullptr && wrong->kind == PostStoreProblem::Kind::unavailable;
  if (wrong != nullptr) {
    count(figures_.spoolFailures);
    if (!std::exchange(entries_.at(number).isFailureTold, true))
      lines_.error("spool: %s", wrong->text.c_str());
    if (lane.isUnread)
      fail(lane);
    else
      setStuck(number);
    return nullptr;
  }
  auto& post = std::get<StoredPost>(read);
  auto message = std::make_shared<LogMessage>();
  message->id = std::move(post.url);
  message->headers = std::move(post.headers);
  message->body = std::string(post.body.view());
  return message;
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

void Spool::showFigures() {
  posts_ = entries_.size() + stuckPosts_;
  oldest_ = entries_.empty() ? 0 : entries_.begin()->second.keptAt;
  for (Lane& lane : lanes_)
    lane.isReplayable = !lane.isUnread && (!lane.waiting.empty() || lane.inFlight != 0);
}

// When a pause ends. What waits for room goes on with a reply.
std::optional<MonotonicTime> Spool::nextTurn(MonotonicTime now, bool takesReplays) const {
  std::optional<MonotonicTime> due;
  if (!toRemove_.empty()) due = now + Limits::replayPause;
  if (!takesReplays) return due;
  for (const Lane& lane : lanes_)
    if (!lane.waiting.empty() && lane.inFlight < lane.window && now < lane.nextReplay)
      due = due ? std::min(*due, lane.nextReplay) : lane.nextReplay;
  return due;
}

std::optional<MonotonicTime> Spool::turn(Replays& replays) {
  takeReplies();
  const Additions added = takeAdditions();
  const bool hadEntries = !entries_.empty();
  const bool isDone = change(added);
  showFigures();
  if (!added.empty()) tell(added, isDone ? SpoolVerdict::kept : SpoolVerdict::broken);
  const bool isEmpty = entries_.size() == toRemove_.size() && stuckPosts_ == 0;
  if (hadEntries && isEmpty) {
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
