#include "platform/base/Counters.h"

#include <algorithm>

namespace kyt {

const char* reasonName(Reason reason) {
  switch (reason) {
    case Reason::malformedMessage:
      return "malformed-message";
    case Reason::invalidArguments:
      return "invalid-arguments";
    case Reason::unentitledConnection:
      return "unentitled-connection";
    case Reason::connectionAtTheEnd:
      return "connection-at-the-end";
    case Reason::acceptFailed:
      return "accept-failed";
    case Reason::handshakeFailed:
      return "handshake-failed";
    case Reason::handshakeTimedOut:
      return "handshake-timed-out";
    case Reason::messageTimedOut:
      return "message-timed-out";
    case Reason::messageTooLong:
      return "message-too-long";
    case Reason::administrationRefused:
      return "administration-refused";
    case Reason::tooManyConnections:
      return "too-many-connections";
    case Reason::tooManyConnectionsOfUser:
      return "too-many-connections-of-user";
    case Reason::tooManyDescriptorsOfUser:
      return "too-many-descriptors-of-user";
    case Reason::userBytesExceeded:
      return "user-bytes-exceeded";
    case Reason::queuedBytesExceeded:
      return "queued-bytes-exceeded";
    case Reason::clientNotReading:
      return "client-not-reading";
    case Reason::aggregatorMessageDropped:
      return "aggregator-message-dropped";
    case Reason::sessionInfoKeyUnknown:
      return "session-info-key-unknown";
    case Reason::sessionInfoValueMistyped:
      return "session-info-value-mistyped";
    case Reason::notConfigured:
      return "not-configured";
    case Reason::noStorebag:
      return "no-storebag";
    case Reason::noBackEnds:
      return "no-back-ends";
    case Reason::identifiersMissing:
      return "identifiers-missing";
    case Reason::categoryOrTypeMissing:
      return "category-or-type-missing";
    case Reason::eventFiltered:
      return "event-filtered";
    case Reason::notForThisBackEnd:
      return "not-for-this-back-end";
    case Reason::adaptorUnavailable:
      return "adaptor-unavailable";
    case Reason::datagramDisplaced:
      return "datagram-displaced";
    case Reason::datagramUnacknowledged:
      return "datagram-unacknowledged";
    case Reason::datagramGivenUp:
      return "datagram-given-up";
    case Reason::batchFull:
      return "batch-full";
    case Reason::userBatchesFull:
      return "user-batches-full";
    case Reason::consentMissing:
      return "consent-missing";
    case Reason::countryNotListed:
      return "country-not-listed";
    case Reason::deviceNotListed:
      return "device-not-listed";
    case Reason::clientNotListed:
      return "client-not-listed";
    case Reason::samplingThresholdMissing:
      return "sampling-threshold-missing";
    case Reason::sampledOut:
      return "sampled-out";
    case Reason::eventDroppedByState:
      return "event-dropped-by-state";
    case Reason::batchDiscarded:
      return "batch-discarded";
    case Reason::batchedEventFiltered:
      return "batched-event-filtered";
    case Reason::postWithoutURL:
      return "post-without-url";
    case Reason::postWithoutPoster:
      return "post-without-poster";
    case Reason::postWithoutClientID:
      return "post-without-client-id";
    case Reason::postFailed:
      return "post-failed";
    case Reason::postRefused:
      return "post-refused";
    case Reason::postRedirected:
      return "post-redirected";
    case Reason::postDisplaced:
      return "post-displaced";
    case Reason::postWithoutRoom:
      return "post-without-room";
    case Reason::postCancelled:
      return "post-cancelled";
    case Reason::outboxDisplaced:
      return "outbox-displaced";
    case Reason::outboxTooOld:
      return "outbox-too-old";
    case Reason::outboxConsentWithdrawn:
      return "outbox-consent-withdrawn";
    case Reason::outboxDropped:
      return "outbox-dropped";
    case Reason::outboxUnreadable:
      return "outbox-unreadable";
    case Reason::postNotKept:
      return "post-not-kept";
    case Reason::outboxFileDamaged:
      return "outbox-file-damaged";
    case Reason::outboxPostUnreadable:
      return "outbox-post-unreadable";
    case Reason::requestFailed:
      return "request-failed";
    case Reason::requestRefused:
      return "request-refused";
    case Reason::requestRedirected:
      return "request-redirected";
    case Reason::waitingRequestDisplaced:
      return "waiting-request-displaced";
    case Reason::outstandingBytesExceeded:
      return "outstanding-bytes-exceeded";
    case Reason::workersExhausted:
      return "workers-exhausted";
    case Reason::sharedDataRefused:
      return "shared-data-refused";
    case Reason::hierarchyTokenRefused:
      return "hierarchy-token-refused";
    case Reason::uploadTooLarge:
      return "upload-too-large";
    case Reason::tooMuchUploadedAtOnce:
      return "too-much-uploaded-at-once";
    case Reason::customIdentifierRefused:
      return "custom-identifier-refused";
    case Reason::badUserDefaultsFile:
      return "bad-user-defaults-file";
    case Reason::badEntitlementsFile:
      return "bad-entitlements-file";
    case Reason::logLineDropped:
      return "log-line-dropped";
    case Reason::messageLogLineLost:
      return "message-log-line-lost";
    case Reason::messageLogShareUsed:
      return "message-log-share-used";
    case Reason::valueNotPostable:
      return "value-not-postable";
    case Reason::fileNotRemoved:
      return "file-not-removed";
    case Reason::powerLogUnavailable:
      return "power-log-unavailable";
    case Reason::powerLogEventDropped:
      return "power-log-event-dropped";
    case Reason::numberOfReasons:
      break;
  }
  return "unknown";
}

bool Counters::addAndMayLog(Reason reason, MonotonicTime now, uint64_t count) {
  add(reason, count);
  constexpr int64_t kMinute = std::chrono::nanoseconds(std::chrono::minutes(1)).count();
  std::atomic<int64_t>& lastLogged = lastLogged_[static_cast<size_t>(reason)];
  // A clock that has just started may read 0, which stands for "never".
  const int64_t time = std::max<int64_t>(now.time_since_epoch().count(), 1);
  int64_t last = lastLogged.load(std::memory_order_relaxed);
  if (last != 0 && time - last < kMinute) return false;
  return lastLogged.compare_exchange_strong(last, time, std::memory_order_relaxed);
}

bool Counters::mayTell(Reason reason, std::string_view subject, MonotonicTime now) {
  const auto isOld = [now](const auto& entry) { return now - entry.second >= std::chrono::minutes(1); };
  constexpr size_t kLongestSubject = 256;  // clients and servers choose its parts
  const std::pair key(reason, std::string(subject.substr(0, kLongestSubject)));
  MutexLock lock(toldMutex_);
  if (const auto known = told_.find(key); known != told_.end()) {
    if (!isOld(*known)) return false;
    known->second = now;
    return true;
  }
  if (told_.size() >= kMostSubjects) std::erase_if(told_, isOld);
  return told_.size() < kMostSubjects && told_.emplace(key, now).second;
}

}  // namespace kyt
