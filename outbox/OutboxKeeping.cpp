// What the outbox keeps, within its bounds: the oldest posts go for newer ones.
#include <algorithm>
#include <utility>

#include "outbox/Outbox.h"
#include "platform/base/Limits.h"
#include "platform/queues/Log.h"

namespace kyt {

// The oldest of the user's where his share is full, the oldest of all where the outbox is. False: there is none that is on
// disk already.
bool Outbox::makeRoom(Plan& plan, uint32_t user, uint64_t bytes) {
  for (;;) {
    const bool isShareFull = posts_.bytesOfUser(user) + bytes > settings_.maxBytesPerUser ||
                             posts_.postsOfUser(user) >= Limits::maxOutboxPostsOfAUser;
    const bool isFull =
        posts_.bytes() + bytes > settings_.maxBytes || posts_.size() >= Limits::maxOutboxPosts;
    if (!isShareFull && !isFull) return true;
    KeptPosts::Entry* oldest = isShareFull ? posts_.oldestOfUser(user) : posts_.oldest();
    if (oldest == nullptr || oldest->number > last_) return false;
    plan.displaced.emplace_back(oldest->number, eventsOf(*oldest));
    posts_.remove(*oldest);
  }
}

// The settings may allow less than what was kept by them.
void Outbox::keepBounds() {
  Plan plan;
  for (const uint32_t user : posts_.users())
    if (posts_.bytes() > settings_.maxBytes || posts_.bytesOfUser(user) > settings_.maxBytesPerUser)
      static_cast<void>(makeRoom(plan, user, 0));
  commit(std::move(plan));
}

void Outbox::keepAll(std::vector<Incoming> posts) {
  Plan plan;
  for (Incoming& incoming : posts) {
    if (!isWaiting(incoming.ticket)) continue;
    StoredPost& post = incoming.failed.post;
    const uint64_t bytes = PostStore::bytesOf(post);
    const bool fits =
        bytes <= settings_.maxBytes && bytes <= settings_.maxBytesPerUser && bytes <= UINT32_MAX;
    const bool isAllowed = !post.isByConsent || (wasConsentGiven_ && noteConsent());
    if (!isLoaded_ || !fits || !isAllowed || diskRests()) {
      refuse(incoming);
      continue;
    }
    if (!makeRoom(plan, post.user, bytes)) {
      commit(std::move(plan));  // what is new is displaced only when it is there
      plan = Plan();
      if (diskRests() || !makeRoom(plan, post.user, bytes)) {
        for (const auto& [number, events] : plan.displaced) posts_.putBack(number);
        plan.displaced.clear();
        refuse(incoming);
        continue;
      }
    }
    post.number = last_ + 1 + static_cast<int64_t>(plan.posts.size());
    post.keptAt = timeNow().value_or(0);
    post.events = incoming.failed.booked ? incoming.failed.booked->rows() : OutboxBooks::Events();
    posts_.add(post.number, serverOfLine(post.url), bytes, post.user, post.isByConsent, seconds()).contents =
        books_.remember(post.events);
    oldestBorn_ = std::min(oldestBorn_, seconds());
    plan.posts.push_back(std::move(incoming));
  }
  commit(std::move(plan));
}

void Outbox::kept(Plan& plan) {
  for (const auto& [number, events] : plan.displaced) books_.drop(number, events, Reason::outboxDisplaced);
  if (!plan.displaced.empty() &&
      ports_.counters.addAndMayLog(Reason::outboxDisplaced, ports_.clock.monotonic(), 0))
    ports_.log.error("Outbox(keep): It is full, %zu of the oldest posts are lost for newer ones",
                     plan.displaced.size());
  size_.store(posts_.size(),
              std::memory_order_relaxed);  // before anybody is told, so that nobody takes it for empty
  for (Incoming& incoming : plan.posts) {
    last_ = incoming.failed.post.number;
    const StoredPost& post = incoming.failed.post;
    if (post.keptAt == 0) untimed_ = last_;
    auto waiting = takeWaiting(incoming.ticket);
    if (!waiting) {  // told already that it is not kept
      removed_.push_back(last_);
      posts_.remove(*posts_.find(last_));
      wake();
      continue;
    }
    books_.enter(last_, incoming.failed.booked, post.events, incoming.failed.status);
    if (incoming.failed.mayHaveLeft)
      tellOwner(post.url, post.events, post.body.view().size(), !incoming.failed.isUnanswered);
    ServerLine& line = *posts_.find(last_)->line;
    line.isUnreachable = line.isUnreachable || incoming.failed.isUnanswered;
    line.lastStatus = incoming.failed.status;
    // What is being sent says by itself how the server is.
    if (line.posts == 1 && line.inFlight == 0) line.failures = 0;
    if (line.inFlight == 0 && line.failures == 0)
      fail(line, incoming.failed.retryAfter, incoming.failed.isUnanswered);
    else if (incoming.failed.retryAfter)
      pause(line, *incoming.failed.retryAfter);
    waiting->settled(true);
  }
}

void Outbox::notKept(Plan& plan) {
  for (Incoming& incoming : plan.posts) {
    posts_.removeNewest();
    refuse(incoming);
  }
  for (const auto& [number, events] : plan.displaced) posts_.putBack(number);
}

}  // namespace kyt
