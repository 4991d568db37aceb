// How the outbox sends again: oldest first to each server, one at a time until one is taken, then some. What becomes of them
// is in OutboxAnswers.cpp, when the next try is in OutboxPauses.cpp.
#include <algorithm>
#include <utility>

#include "outbox/Outbox.h"
#include "platform/base/Limits.h"

namespace kyt {

// What left by an answer is off the disk before more is sent: so a process that is killed sends nothing twice but what was
// on its way.
void Outbox::sendWhatIsDue() {
  if (isStopping_ || !isLoaded_ || !removed_.empty() || diskRests()) return;
  if (ports_.clock.monotonic() < readingRestsUntil_) return;
  std::vector<ServerLine*> due;
  for (auto& [server, line] : posts_.lines())
    if (line.posts != 0 && line.nextTry <= ports_.clock.monotonic()) due.push_back(&line);
  // Where there is not a place for each, who has waited longest comes first.
  std::sort(due.begin(), due.end(),
            [](const ServerLine* a, const ServerLine* b) { return a->nextTry < b->nextTry; });
  for (ServerLine* line : due) sendFrom(*line);
}

// Each silent server holds its place until its time-out: however many there are, they hold up one another alone. Those that
// fall silent only now may all have several on their way: these leave room for one to each of the others.
bool Outbox::hasPlaceFor(const ServerLine& line) {
  if (inFlight_.size() >= Limits::maxOutboxRequestsInFlight) return false;
  if (line.isPrompt && line.inFlight == 0) return true;
  size_t toSlow = 0;
  for (const auto& [number, sending] : inFlight_) toSlow += sending->line->isPrompt ? 0 : 1;
  return line.isPrompt ? inFlight_.size() - toSlow < Limits::mostOutboxRequestsBesideOthers
                       : toSlow < Limits::maxOutboxRequestsToSlowServers;
}

void Outbox::sendFrom(ServerLine& line) {
  const size_t most = line.isOpen ? kMostAtATime : 1;
  while (line.inFlight < most && ports_.clock.monotonic() >= line.nextTry) {
    if (line.inFlight > 0 && bytesInFlight_ >= Limits::maxOutboxBytesInFlight) return;
    if (!hasPlaceFor(line)) return;
    const MonotonicTime now = ports_.clock.monotonic();
    KeptPosts::Entry* next = posts_.next(line, now);
    if (next == nullptr) {
      if (const auto due = KeptPosts::whenDue(line); due && line.inFlight == 0)
        setNextTry(line, std::max(*due, now));
      return;
    }
    if (!send(*next)) return;
  }
}

std::shared_ptr<URLSession> Outbox::sessionFor(ServerLine& line, const StoredPost& post) {
  for (ServerLine::Sender& sender : line.senders) {
    if (sender.identity != post.identity || sender.sourceApplication != post.sourceApplication) continue;
    ++sender.inFlight;
    return sender.session;
  }
  std::erase_if(line.senders, [](const ServerLine::Sender& sender) { return sender.inFlight == 0; });
  URLSessionConfiguration configuration;
  configuration.sourceApplication = post.sourceApplication;
  std::shared_ptr<URLSession> session = ports_.network.create(std::move(configuration));
  line.senders.push_back({post.identity, post.sourceApplication, session, 1});
  return session;
}

bool Outbox::send(KeptPosts::Entry& entry) {
  ServerLine& line = *entry.line;
  auto read = ports_.store.read(entry.number);
  if (const auto* problem = std::get_if<PostStoreProblem>(&read)) {
    if (problem->kind == PostStoreProblem::Kind::unavailable) return cannotRead(entry, *problem);
    if (problem->kind == PostStoreProblem::Kind::damaged)
      handle(*problem);
    else
      lose(entry, *problem);
    return false;
  }
  ++diskWork_;
  unreadInARow_ = 0;
  auto& post = std::get<StoredPost>(read);
  auto sending = std::make_shared<Sending>();
  sending->number = entry.number;
  sending->line = &line;
  sending->bytes = entry.bytes;
  sending->bodyBytes = post.body.view().size();
  sending->url = post.url;
  sending->session = sessionFor(line, post);
  sending->since = ports_.clock.monotonic();
  sending->events = std::move(post.events);
  URLRequest request;
  request.method = "POST";
  request.url = std::move(post.url);
  request.headers = std::move(post.headers);
  request.body = std::move(post.body);
  request.allowsCellularAccess = post.allowsCellularAccess;
  request.identity = std::move(post.identity);
  request.neverWaits = true;  // the consent is asked before it leaves, whenever that is
  posts_.setInFlight(entry, true);
  inFlight_[sending->number] = sending;
  ++line.inFlight;
  bytesInFlight_ += sending->bytes;
  line.lastTry = ports_.clock.monotonic();
  sending->task = sending->session->start(
      std::move(request), [weak = weak_from_this(), answeredSending = std::weak_ptr(sending)](
                              const std::optional<Data>&, const std::optional<URLResponse>& response,
                              const std::optional<Error>& error) {
        const auto self = weak.lock();
        auto answer = answeredSending.lock();
        if (!self || !answer) return;
        const URLResponse* answered = response ? &*response : nullptr;
        {
          MutexLock lock(self->mutex_);
          self->inbox_.answers.push_back({std::move(answer), verdictOf(answered, error ? &*error : nullptr),
                                          retryAfter(answered, self->ports_.clock.timeOfDay()),
                                          answered == nullptr, mayHaveLeft(response, error),
                                          answered != nullptr ? answered->status : 0});
        }
        self->wake();
      });
  return true;
}

void Outbox::setTimer() {
  timer_.cancel();
  const bool mustRemove = !removed_.empty() || removesForGood_ || mustRemoveSetAside_;
  if (posts_.size() == 0 && !mustRemove && isLoaded_) return;
  const MonotonicTime now = ports_.clock.monotonic();
  MonotonicTime next = now + kLongestRest;
  if (diskRests() || !isLoaded_ || mustRemove) {
    next = now + kDiskPause;
  } else if (!isStopping_) {
    for (const auto& [server, line] : posts_.lines())
      if (line.posts != 0 && line.inFlight == 0 && line.nextTry > now) next = std::min(next, line.nextTry);
    for (const MonotonicTime until : {readingRestsUntil_, notingRestsUntil_})
      if (until > now) next = std::min(next, until);
  }
  timer_ =
      ports_.timers.after(std::max<Duration>(next - now, Duration(0)), queue_, [weak = weak_from_this()] {
        if (const auto self = weak.lock()) {
          self->queue_->assertCurrent();
          self->turn();
        }
      });
}

void Outbox::watchConnectivity() {
  bool someFail = false, someAreUnreachable = false;
  for (const auto& [server, line] : posts_.lines()) {
    someFail = someFail || (line.posts != 0 && line.failures != 0);
    someAreUnreachable = someAreUnreachable || (line.posts != 0 && line.failures != 0 && line.isUnreachable);
  }
  someFail_.store(someFail, std::memory_order_relaxed);
  const bool isWanted = someAreUnreachable && !isStopping_;
  if (std::exchange(isWatching_, isWanted) == isWanted) return;
  std::shared_ptr<Function<void()>> changed;
  if (isWanted)
    changed = std::make_shared<Function<void()>>([weak = weak_from_this()] {
      const auto self = weak.lock();
      if (!self) return;
      {
        MutexLock lock(self->mutex_);
        self->inbox_.connectivityChanged = true;
      }
      self->wake();
    });
  ports_.network.watchConnectivity(std::move(changed));
}

void Outbox::stopSending() {
  if (isStopping_.exchange(true)) return;
  queue_->asyncBeside([self = shared_from_this()] {
    self->queue_->assertCurrent();
    for (auto& [number, sending] : self->inFlight_)
      if (sending->task) sending->task->cancel();
    self->watchConnectivity();
  });
}

}  // namespace kyt
