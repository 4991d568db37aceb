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

Spool::Spool(PostStore& store, uint64_t maxBytes, const Clock& clock, Figures& figures, Log& lines)
    : store_(store), maxBytes_(maxBytes), clock_(clock), figures_(figures), lines_(lines) {}

Spool::~Spool() {
  stop();
}

std::optional<std::string> Spool::open() {
  for (bool again : {true, false}) {
    const auto wrong = store_.open([this](StoredPostHead head) {
      if (head.isUnreadable) return count(figures_.stuck);
      entries_[head.post.number] = {head.bytes, head.post.keptAt};
      lastNumber_ = std::max(lastNumber_, head.post.number);
      bytes_ += head.bytes;
    });
    if (!wrong) break;
    if (wrong->kind != PostStoreProblem::Kind::damaged || !again) return wrong->text;
    entries_.clear();
    bytes_ = 0;
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
  {
    MutexLock lock(mutex_);
    replies.swap(replies_);
    if (std::exchange(isWoken_, false)) nextReplay_ = {};
  }
  for (const auto& [number, result] : replies) {
    const auto known = entries_.find(number);
    if (known == entries_.end() || known->second.state != Entry::State::inFlight) continue;
    --inFlight_;
    inFlightBytes_ -= known->second.bytes;
    switch (result) {
      case SpoolReplay::stored:
        known->second.state = Entry::State::stored;
        toRemove_.push_back(number);
        count(figures_.replayed);
        break;
      case SpoolReplay::failed:
        known->second.state = Entry::State::waiting;
        hasFailed_ = true;
        break;
      case SpoolReplay::never:  // it was answered as taken, so it stays for a person to look at
        known->second.state = Entry::State::stuck;
        count(figures_.stuck);
        break;
    }
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
      for (const auto& [number, entry] : entries_) bytes_ -= entry.bytes;
      entries_.clear();
      toRemove_.clear();
      inFlight_ = inFlightBytes_ = 0;
    }
    return false;
  }
  if (isBroken_.exchange(false)) lines_.normal("spool: it can be written to again");
  for (size_t i = 0; i < added.size(); ++i) entries_[++lastNumber_] = {added[i]->bytes, now};
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

std::shared_ptr<const LogMessage> Spool::read(int64_t number, Entry& entry) {
  auto read = store_.read(number);
  if (const auto* wrong = std::get_if<PostStoreProblem>(&read)) {
    lines_.error("spool: %s", wrong->text.c_str());
    if (wrong->kind == PostStoreProblem::Kind::post) {
      entry.state = Entry::State::stuck;
      count(figures_.stuck);
    } else {
      isBroken_ = true;
    }
    return nullptr;
  }
  auto& post = std::get<StoredPost>(read);
  auto message = std::make_shared<LogMessage>();
  message->id = std::move(post.url);
  message->headers = std::move(post.headers);
  message->body = std::string(post.body.view());
  return message;
}

void Spool::replayMore(Replays& replays) {
  if (hasFailed_) {
    if (inFlight_ != 0) return;
    hasFailed_ = false;
    cursor_ = 0;
    nextReplay_ = clock_.monotonic() + Limits::replayPause;
  }
  if (clock_.monotonic() < nextReplay_) return;
  for (auto next = entries_.upper_bound(cursor_); next != entries_.end(); ++next) {
    if (inFlight_ >= Limits::maxReplayPosts || inFlightBytes_ >= Limits::maxReplayBytes) return;
    auto& [number, entry] = *next;
    cursor_ = number;
    if (entry.state != Entry::State::waiting) continue;
    if (!replays.takesReplays()) {
      hasFailed_ = true;
      return;
    }
    const auto message = read(number, entry);
    if (!message) {
      if (entry.state != Entry::State::waiting) continue;
      hasFailed_ = true;
      return;
    }
    entry.state = Entry::State::inFlight;
    ++inFlight_;
    inFlightBytes_ += entry.bytes;
    replays.replay(number, message);
  }
}

void Spool::showFigures() {
  posts_ = entries_.size();
  oldest_ = entries_.empty() ? 0 : entries_.begin()->second.keptAt;
  replayable_ = static_cast<uint64_t>(std::any_of(entries_.begin(), entries_.end(), [](const auto& entry) {
    return entry.second.state == Entry::State::waiting || entry.second.state == Entry::State::inFlight;
  }));
}

std::optional<MonotonicTime> Spool::turn(Replays& replays) {
  takeReplies();
  const Additions added = takeAdditions();
  const bool hadEntries = !entries_.empty();
  const bool isDone = change(added);
  showFigures();
  if (!added.empty()) tell(added, isDone ? SpoolVerdict::kept : SpoolVerdict::broken);
  const bool isEmpty = entries_.size() == toRemove_.size();
  if (hadEntries && isEmpty) {
    // On a full disk nothing can be removed row by row; the whole file can.
    store_.becameEmpty();
    if (isDone) lines_.normal("spool: it is empty");
  }
  replayMore(replays);
  showFigures();
  if (!toRemove_.empty()) return clock_.monotonic() + Limits::replayPause;
  if (hasFailed_ && inFlight_ == 0) return clock_.monotonic();
  if (replayable_ != 0 && inFlight_ == 0) return std::max(nextReplay_, clock_.monotonic());
  return std::nullopt;
}

}  // namespace kyt::receiver
