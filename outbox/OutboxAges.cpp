// How long the outbox keeps posts: until they are too old, or the consent by which they were collected is gone.
#include <algorithm>
#include <limits>
#include <utility>

#include "outbox/Outbox.h"
#include "platform/DeviceProperties.h"
#include "platform/queues/Log.h"

namespace kyt {
namespace {

constexpr int64_t kClockWasSet = 1577836800;  // a clock before 2020 has not been set
// So long a clock must say that posts of an earlier process are too old, over restarts too, until they are deleted: one that
// was wrong for a moment deletes nothing.
constexpr int64_t kBelievedAfter = 3600;

}  // namespace

int64_t Outbox::seconds() const {
  return std::chrono::duration_cast<std::chrono::seconds>(ports_.clock.sinceBoot()).count();
}

std::optional<int64_t> Outbox::timeNow() const {
  const int64_t now = ports_.clock.timeOfDay().seconds;
  return now >= kClockWasSet ? std::optional(now) : std::nullopt;
}

// A post of which nobody knows when it was kept is new. One that lies ahead is so too.
int64_t Outbox::bornAt(int64_t keptAt) const {
  const auto now = timeNow();
  if (keptAt == 0 || !now || keptAt > *now) return seconds();
  return seconds() - (*now - keptAt);
}

void Outbox::noteAge(const StoredPost& post) {
  const auto now = timeNow();
  if (post.keptAt == 0 || (now && post.keptAt > *now)) untimed_ = post.number;
  if (!now) hasAgesToTake_ = true;
  oldestBorn_ = std::min(oldestBorn_, bornAt(post.keptAt));
}

// Of what was there at the start, by what the clock says now.
void Outbox::takeAges() {
  static_cast<void>(ports_.store.open([this](const StoredPostHead& head) {
    queue_->assertCurrent();
    KeptPosts::Entry* entry =
        head.isUnreadable || head.post.number > lastLoaded_ ? nullptr : posts_.find(head.post.number);
    if (entry != nullptr) entry->born = bornAt(head.post.keptAt);
  }));
  oldestBorn_ = std::numeric_limits<int64_t>::max();
  for (const KeptPosts::Entry& entry : posts_.entries())
    if (!entry.isGone) oldestBorn_ = std::min(oldestBorn_, entry.born);
}

// What was kept before the clock was set gets the time at which it is: that stays, so it grows old.
void Outbox::takeTime() {
  const auto now = timeNow();
  if (!now || diskRests()) return;
  if (std::exchange(hasAgesToTake_, false)) {
    takeAges();
    takePauses();
  }
  if (pausesAheadUntil_ != 0 && (*now >= pausesAheadUntil_ || seconds() - loadedAt_ >= kBelievedAfter)) {
    pausesAheadUntil_ = 0;
    takePauses(true);
  }
  if (untimed_ == 0) return;
  if (const auto problem = ports_.store.setLatest(untimed_, *now)) return handle(*problem);
  untimed_ = 0;
}

// Posts that are too old at the start are so by the time of day alone. False: that is not believed yet.
bool Outbox::believesAges() {
  const auto now = timeNow();
  if (!now) return false;
  const int64_t since = ports_.store.note(PostStore::Note::tooOldSince);
  if (since != 0 && since <= *now && *now - since >= kBelievedAfter) return true;
  if (since == 0 || since > *now) {
    ports_.log.normal(
        "Outbox: By the clock some posts are too old, they are deleted in %lld s unless it changes",
        static_cast<long long>(kBelievedAfter));
    if (const auto problem = ports_.store.setNote(PostStore::Note::tooOldSince, *now)) handle(*problem);
  }
  return false;
}

void Outbox::forgetTooOld() {
  const int64_t now = seconds(), oldest = now - static_cast<int64_t>(settings_.maxAgeSeconds);
  const auto time = timeNow();
  if (time && now >= nextSetAsideLook_) {
    nextSetAsideLook_ = now + kBelievedAfter;
    static_cast<void>(ports_.store.removeSetAside(*time - static_cast<int64_t>(settings_.maxAgeSeconds)));
  }
  if (oldestBorn_ >= oldest || now < nextAgeLook_ || diskRests()) return;
  // What has grown too old since the start did so by the clock that counts from the boot.
  if (oldestBorn_ < loadedAt_ - static_cast<int64_t>(settings_.maxAgeSeconds)) {
    takeAges();
    nextAgeLook_ = now + kBelievedAfter / 4;
    if (oldestBorn_ >= oldest) return doubtNoAges();
    if (!believesAges()) return;
  }
  oldestBorn_ = std::numeric_limits<int64_t>::max();
  for (KeptPosts::Entry& entry : posts_.entries()) {
    if (entry.isGone) continue;
    if (entry.born < oldest)
      leave(entry, Reason::outboxTooOld);
    else
      oldestBorn_ = std::min(oldestBorn_, entry.born);
  }
  doubtNoAges();
}

void Outbox::doubtNoAges() {
  if (posts_.size() != 0 && ports_.store.note(PostStore::Note::tooOldSince) != 0)
    static_cast<void>(ports_.store.setNote(PostStore::Note::tooOldSince, 0));
}

// Before the first post that is collected by it. False: the disk does not take that.
bool Outbox::noteConsent() {
  if (posts_.byConsent() != 0 || isConsentNoted_) return true;
  if (const auto problem =
          ports_.store.setNote(PostStore::Note::consentEpoch, static_cast<int64_t>(consentEpoch_))) {
    handle(*problem);
    return false;
  }
  isConsentNoted_ = true;
  return true;
}

// The consent may also have been withdrawn and given again since, perhaps by an administrator while no daemon ran.
void Outbox::forgetWithoutConsent() {
  const uint64_t epoch = ports_.consent.epoch();
  const bool isAnother = std::exchange(consentEpoch_, epoch) != epoch;
  const bool wasGiven = std::exchange(wasConsentGiven_, ports_.consent.isSubmissionAllowed());
  if (isAnother) isConsentNoted_ = false;
  if (wasConsentGiven_ && !isAnother) return;
  if (!wasConsentGiven_ && (wasGiven || isAnother)) {
    mustRemoveSetAside_ = true;  // nobody knows what is in it
    removesForGood_ = true;      // what was sent has left traces
  }
  if (mustRemoveSetAside_)
    mustRemoveSetAside_ = !ports_.store.removeSetAside(std::numeric_limits<int64_t>::max());
  const bool isOfAnother = posts_.byConsent() != 0 && ports_.store.note(PostStore::Note::consentEpoch) !=
                                                          static_cast<int64_t>(consentEpoch_);
  if (posts_.byConsent() == 0 || (wasConsentGiven_ && !isOfAnother)) return;
  ports_.log.normal("Outbox: The consent is withdrawn, %zu posts that were collected by it are deleted",
                    posts_.byConsent());
  for (KeptPosts::Entry& entry : posts_.entries())
    if (!entry.isGone && entry.isByConsent) leave(entry, Reason::outboxConsentWithdrawn);
  removesForGood_ = true;
}

}  // namespace kyt
