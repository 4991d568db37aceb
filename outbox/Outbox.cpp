// What comes in and how it waits for the disk, and the outbox's turns. OutboxKeeping.cpp keeps it, OutboxSending.cpp sends it
// again.
#include "outbox/Outbox.h"

#include <algorithm>
#include <utility>

#include "platform/DeviceProperties.h"
#include "platform/base/Limits.h"
#include "platform/base/Semaphore.h"
#include "platform/queues/Log.h"

namespace kyt {
namespace {

// The pool gives one thread to each owner, so this queue runs beside one that waits for the disk. No user has this number.
constexpr uint64_t kDeadlinesOwner = ~uint64_t{0};

}  // namespace

std::shared_ptr<Outbox> Outbox::create(Ports ports, OutboxSettings settings) {
  return std::shared_ptr<Outbox>(new Outbox(ports, settings));
}

Outbox::Outbox(Ports ports, OutboxSettings settings)
    : ports_(ports),
      settings_(settings),
      queue_(SerialQueue::create("kyt.outbox", ports.executor)),
      deadlines_(SerialQueue::create("kyt.outbox deadlines", ports.executor, kDeadlinesOwner)),
      books_(ports.books, ports.counters) {}

void Outbox::begin() {
  wake();
}

void Outbox::wake() {
  {
    MutexLock lock(mutex_);
    if (std::exchange(isAwake_, true)) return;
  }
  queue_->asyncBeside([self = shared_from_this()] {
    self->queue_->assertCurrent();
    self->turn();
  });
}

bool Outbox::isTaking() const {
  MutexLock lock(mutex_);
  return ports_.clock.monotonic() >= diskRestsUntil_ && !isDiskSlow_;
}

bool Outbox::diskRests() const {
  MutexLock lock(mutex_);
  return ports_.clock.monotonic() < diskRestsUntil_;
}

bool Outbox::isConsentGiven() const {
  return ports_.consent.isSubmissionAllowed();
}

void Outbox::refuse(const std::string& server, Function<void(bool)> settled) {
  if (ports_.counters.addAndMayLog(Reason::postNotKept, ports_.clock.monotonic()))
    ports_.log.error("Outbox(keep): A post to %s that failed cannot be kept", server.c_str());
  settled(false);
}

void Outbox::refuse(const Incoming& post) {
  if (auto waiting = takeWaiting(post.ticket)) refuse(waiting->server, std::move(waiting->settled));
}

std::optional<Outbox::Waiting> Outbox::takeWaiting(uint64_t ticket) {
  MutexLock lock(mutex_);
  auto known = waiting_.extract(ticket);
  if (known.empty()) return std::nullopt;
  return std::move(known.mapped());
}

bool Outbox::isWaiting(uint64_t ticket) const {
  MutexLock lock(mutex_);
  return waiting_.contains(ticket);
}

// One post finds room however large it is; what one user has on the way takes nobody else's.
bool Outbox::hasRoomOnTheWay(uint32_t user, size_t bytes) {
  const auto known = bytesOfUsersOnTheWay_.find(user);
  const size_t ofUser = known != bytesOfUsersOnTheWay_.end() ? known->second : 0;
  return (bytesOnTheWay_ == 0 || bytesOnTheWay_ + bytes <= Limits::maxBytesOnTheWayToTheOutbox) &&
         (ofUser == 0 || ofUser + bytes <= Limits::maxBytesOfAUserOnTheWayToTheOutbox);
}

void Outbox::keep(FailedPost post, Function<void(bool)> settled) {
  if (takeIn(post, settled))
    wake();
  else
    refuse(serverOfLine(post.post.url), std::move(settled));
}

bool Outbox::takeIn(FailedPost& post, Function<void(bool)>& settled) {
  const uint64_t bytes = PostStore::bytesOf(post.post);
  const uint32_t user = post.post.user;
  std::string server = serverOfLine(post.post.url);
  MutexLock lock(mutex_);
  const MonotonicTime now = ports_.clock.monotonic();
  if (now < diskRestsUntil_ || isDiskSlow_ || !hasRoomOnTheWay(user, bytes)) return false;
  bytesOnTheWay_ += bytes;
  bytesOfUsersOnTheWay_[user] += bytes;
  inbox_.bytes += bytes;
  inbox_.bytesOfUsers[user] += bytes;
  inbox_.posts.push_back({std::move(post), ++lastTicket_});
  waiting_[lastTicket_] = {std::move(settled), now, std::move(server)};
  watchDeadline();
  return true;
}

void Outbox::watchDeadline() {
  if (isDeadlineWatched_ || waiting_.empty()) return;
  isDeadlineWatched_ = true;
  const Duration left = waiting_.begin()->second.since + Limits::outboxCommitTime - ports_.clock.monotonic();
  deadline_ = ports_.timers.after(left, deadlines_, [weak = weak_from_this()] {
    if (const auto self = weak.lock()) self->tellWhoWaitedTooLong();
  });
}

// The disk may be stuck in the midst of a change: who waits for it goes on without, and nobody else begins to wait.
void Outbox::tellWhoWaitedTooLong() {
  std::vector<Waiting> late;
  {
    MutexLock lock(mutex_);
    isDeadlineWatched_ = false;
    const MonotonicTime since = ports_.clock.monotonic() - Limits::outboxCommitTime;
    while (!waiting_.empty() && waiting_.begin()->second.since <= since)
      late.push_back(std::move(waiting_.extract(waiting_.begin()).mapped()));
    isDiskSlow_ = isDiskSlow_ || !late.empty();
    watchDeadline();
  }
  if (late.empty()) return;
  ports_.log.error("Outbox: Its disk has taken longer than %lld s, %zu posts go the usual way",
                   static_cast<long long>(Limits::outboxCommitTime.count()), late.size());
  for (Waiting& waiting : late) refuse(waiting.server, std::move(waiting.settled));
}

void Outbox::serverAnswers(std::string_view url) {
  if (!someFail_.load(std::memory_order_relaxed)) return;
  constexpr size_t kMostServers = 64;
  {
    std::string server = serverOfLine(url);
    MutexLock lock(mutex_);
    std::vector<std::string>& known = inbox_.answering;
    if (known.size() >= kMostServers || std::find(known.begin(), known.end(), server) != known.end()) return;
    known.push_back(std::move(server));
  }
  wake();
}

void Outbox::flush() {
  {
    MutexLock lock(mutex_);
    inbox_.flush = true;
  }
  wake();
}

void Outbox::turn() {
  Inbox inbox;
  {
    MutexLock lock(mutex_);
    isAwake_ = false;
    std::swap(inbox, inbox_);
  }
  if (!isLoaded_) load();
  for (Answer& answer : inbox.answers) take(answer);
  if (isLoaded_) {
    forgetWithoutConsent();
    takeTime();
    forgetTooOld();
    // By itself, so that a log that cannot be cut short says nothing of what is new.
    if (removesForGood_) {
      notePauses();
      commit(Plan());
    }
  }
  keepAll(std::move(inbox.posts));
  turnIsOver(inbox);
  takeNews(inbox);
  notePauses();
  if (posts_.size() == 0 && isLoaded_) {
    books_.dropRest(Reason::outboxUnreadable);  // of posts that were not what had been kept
    if (removed_.empty() && size_.load(std::memory_order_relaxed) != 0) {
      ports_.store.becameEmpty();
      forgetNoted();
      isConsentNoted_ = false;
    }
  }
  posts_.forgetGone();
  if (posts_.size() == 0) books_.forgetContents();
  books_.forgetUnwatched();
  size_.store(posts_.size(), std::memory_order_relaxed);
  if (isClosed_) return ports_.store.close();
  sendWhatIsDue();
  watchConnectivity();
  setTimer();
}

// All that came before it is on disk, or told.
void Outbox::turnIsOver(const Inbox& inbox) {
  MutexLock lock(mutex_);
  bytesOnTheWay_ -= inbox.bytes;
  for (const auto& [user, bytes] : inbox.bytesOfUsers) {
    const auto known = bytesOfUsersOnTheWay_.find(user);
    known->second -= bytes;
    if (known->second == 0) bytesOfUsersOnTheWay_.erase(known);
  }
  if (std::exchange(isDiskSlow_, false)) diskRestsUntil_ = ports_.clock.monotonic() + kDiskPause;
}

void Outbox::leave(KeptPosts::Entry& entry, Reason fate) {
  const OutboxBooks::Events events = eventsOf(entry);
  if (const auto sending = inFlight_.find(entry.number); sending != inFlight_.end()) {
    sending->second->isAbandoned = true;
    if (sending->second->task) sending->second->task->cancel();
  }
  books_.drop(entry.number, events, fate);
  removed_.push_back(entry.number);
  posts_.remove(entry);
}

std::vector<Outbox::Server> Outbox::list() {
  return queue_->sync([this] {
    queue_->assertCurrent();
    const MonotonicTime now = ports_.clock.monotonic();
    std::map<const ServerLine*, Server> lines;
    for (const KeptPosts::Entry& entry : posts_.entries()) {
      if (entry.isGone) continue;
      Server& server = lines[entry.line];
      if (server.users.empty()) server.oldest = std::chrono::seconds(seconds() - entry.born);
      Server::User& user = server.users[entry.user];
      ++user.posts;
      user.bytes += entry.bytes;
    }
    std::vector<Server> servers;
    for (auto& [name, line] : posts_.lines()) {
      if (line.posts == 0) continue;
      Server& server = servers.emplace_back(std::move(lines[&line]));
      server.server = name;
      server.posts = line.posts;
      server.bytes = line.bytes;
      server.inFlight = line.inFlight;
      server.failures = line.failures;
      server.lastStatus = line.lastStatus;
      for (const auto& [number, aside] : line.aside) server.failingAlone += aside.strikes != 0 ? 1 : 0;
      if (line.inFlight == 0) server.untilNextTry = std::max(Duration(0), line.nextTry - now);
    }
    return servers;
  });
}

Outbox::Dropped Outbox::drop(Filter filter) {
  return queue_->sync([&] {
    queue_->assertCurrent();
    Dropped dropped;
    if (!isLoaded_) load();
    for (KeptPosts::Entry& entry : posts_.entries()) {
      const bool isMeant = !entry.isGone && (!filter.user || *filter.user == entry.user) &&
                           (!filter.server || *filter.server == entry.line->server);
      if (!isMeant) continue;
      leave(entry, Reason::outboxDropped);
      ++dropped.posts;
    }
    removesForGood_ = removesForGood_ || dropped.posts != 0;
    turn();
    if (!isLoaded_)
      dropped.problem = "the disk does not say what there is";
    else if (!removed_.empty() || removesForGood_)
      dropped.problem = "the disk does not let them go yet; the daemon asks it again while it runs";
    return dropped;
  });
}

bool Outbox::finishWithin(Duration patience) {
  stopSending();
  const auto done = std::make_shared<Semaphore>();
  queue_->asyncBeside([self = shared_from_this(), done] {
    self->queue_->assertCurrent();
    self->isClosed_ = true;
    self->turn();
    done->signal();
  });
  return done->waitFor(patience);
}

}  // namespace kyt
