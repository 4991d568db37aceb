// The outbox and its disk: what it reads at the start, changes and what it does when the disk fails.
#include <algorithm>
#include <utility>

#include "outbox/Outbox.h"
#include "platform/base/Limits.h"
#include "platform/queues/Log.h"

namespace kyt {
namespace {

// A post that could not be read so often, although the disk did other work meanwhile, is lost.
constexpr unsigned kMostUnread = 3;
// So many posts that cannot be read, and none between them that can, are no matter of the posts.
constexpr unsigned kUnreadInARow = 4;
constexpr unsigned kMostDoublings = 6;

}  // namespace

void Outbox::load() {
  if (diskRests()) return;
  std::map<BookRowName, uint64_t> found;
  std::vector<int64_t> unreadable;
  const auto problem = ports_.store.open([this, &found, &unreadable](StoredPostHead head) {
    queue_->assertCurrent();
    if (head.isUnreadable) return unreadable.push_back(head.post.number);
    StoredPost& post = head.post;
    for (const auto& [row, count] : post.events) found[row] += count;
    posts_
        .add(post.number, serverOfLine(post.url), head.bytes, post.user, post.isByConsent,
             bornAt(post.keptAt))
        .contents = books_.remember(post.events);
    last_ = post.number;
    noteAge(post);
  });
  if (problem && problem->kind == PostStoreProblem::Kind::unavailable) {
    // Once more, from the beginning.
    posts_.clear();
    oldestBorn_ = std::numeric_limits<int64_t>::max();
    books_.forgetContents();
    return handle(*problem);
  }
  isLoaded_ = true;
  loadedAt_ = seconds();
  OutboxBooks::Events all;
  for (const auto& [row, count] : found) all.push_back({row, count});
  books_.restore(all);
  if (problem) return handle(*problem);
  forgetUnreadable(unreadable);
  lastLoaded_ = last_;
  takePauses();
  if (oldestBorn_ >= loadedAt_ - static_cast<int64_t>(settings_.maxAgeSeconds)) doubtNoAges();
  if (posts_.size() == 0) return;
  ports_.log.normal("Outbox: %zu posts of %llu bytes are left from before", posts_.size(),
                    static_cast<unsigned long long>(posts_.bytes()));
  // Devices that start at the same time do not all ask at the same time.
  for (auto& [server, line] : posts_.lines()) fail(line, std::nullopt, true);
  keepBounds();
}

// Of these is not even known whose they were.
void Outbox::forgetUnreadable(const std::vector<int64_t>& numbers) {
  if (numbers.empty()) return;
  ports_.counters.add(Reason::outboxPostUnreadable, numbers.size());
  ports_.log.error("Outbox: Its file is damaged at %zu places, the posts there are lost", numbers.size());
  constexpr int64_t kGreatest = int64_t{1} << 53;
  for (const int64_t number : numbers) {
    if (number != 0) removed_.push_back(number);
    if (number <= kGreatest) last_ = std::max(last_, number);
  }
}

OutboxBooks::Events Outbox::eventsOf(const KeptPosts::Entry& entry) {
  if (const auto* known = books_.remembered(entry.contents)) return *known;
  if (const auto sending = inFlight_.find(entry.number); sending != inFlight_.end())
    return sending->second->events;
  auto read = ports_.store.read(entry.number);
  if (auto* post = std::get_if<StoredPost>(&read)) return std::move(post->events);
  return {};
}

void Outbox::commit(Plan plan) {
  if (plan.posts.empty() && plan.displaced.empty() && removed_.empty() && !removesForGood_) return;
  if (diskRests()) return notKept(plan);
  std::vector<const StoredPost*> added;
  added.reserve(plan.posts.size());
  for (const Incoming& post : plan.posts) added.push_back(&post.failed.post);
  const size_t removedBefore = removed_.size();
  for (const auto& [number, events] : plan.displaced) removed_.push_back(number);
  if (const auto problem = ports_.store.change(added, removed_, removesForGood_)) {
    removed_.resize(removedBefore);
    notKept(plan);
    return handle(*problem);
  }
  ++diskWork_;
  removed_.clear();
  if (removesForGood_ && posts_.byConsent() == 0) isConsentNoted_ = false;  // the file may be gone
  if (std::exchange(removesForGood_, false) && posts_.size() == 0) forgetNoted();
  kept(plan);
}

// One post that the disk does not give is no reason to leave the others. It is lost when that has happened often enough
// while the disk did other work. False: nothing more is to be read for now.
bool Outbox::cannotRead(KeptPosts::Entry& entry, const PostStoreProblem& problem) {
  const MonotonicTime now = ports_.clock.monotonic();
  ServerLine::Aside& aside = KeptPosts::setUnread(entry);
  if (aside.unread == 0 || aside.workBefore != diskWork_) ++aside.unread;
  aside.workBefore = diskWork_;
  ++aside.unreadTries;
  const Duration pause = kDiskPause * (1U << std::min(aside.unreadTries - 1, kMostDoublings));
  aside.notBefore = now + std::min<Duration>(pause, kLongestRest);
  if (aside.unread >= kMostUnread) {
    lose(entry, problem);
  } else if (ports_.counters.mayTell(Reason::outboxUnreadable, problem.text, now)) {
    ports_.log.error("Outbox: A post to %s cannot be read for now: %s", entry.line->server.c_str(),
                     problem.text.c_str());
  }
  if (++unreadInARow_ < kUnreadInARow) return true;
  unreadInARow_ = 0;
  readingRestsUntil_ = now + kDiskPause;
  return false;
}

void Outbox::lose(KeptPosts::Entry& entry, const PostStoreProblem& problem) {
  ports_.log.error("Outbox: A post to %s is lost: %s", entry.line->server.c_str(), problem.text.c_str());
  ports_.counters.add(Reason::outboxPostUnreadable);
  books_.drop(entry.number, eventsOf(entry), Reason::outboxUnreadable);
  removed_.push_back(entry.number);
  posts_.remove(entry);
  wake();
}

void Outbox::handle(const PostStoreProblem& problem) {
  if (problem.kind == PostStoreProblem::Kind::damaged) {
    ports_.counters.add(Reason::outboxFileDamaged);
    ports_.log.error("Outbox: Its file is damaged, %zu posts are lost: %s; %s", posts_.size(),
                     problem.text.c_str(), ports_.store.setAside().c_str());
    for (auto& [number, sending] : inFlight_) sending->isAbandoned = true;
    posts_.clear();
    removed_.clear();
    removesForGood_ = false;
    books_.dropRest(Reason::outboxUnreadable);
    if (!wasConsentGiven_)
      mustRemoveSetAside_ = !ports_.store.removeSetAside(std::numeric_limits<int64_t>::max());
    isConsentNoted_ = false;
    forgetNoted();
    return;
  }
  {
    MutexLock lock(mutex_);
    diskRestsUntil_ = ports_.clock.monotonic() + kDiskPause;
  }
  if (ports_.counters.mayTell(Reason::postNotKept, problem.text, ports_.clock.monotonic()))
    ports_.log.error("Outbox: Its file cannot be used for now: %s", problem.text.c_str());
}

}  // namespace kyt
