// What was dropped or refused, by reason. Any thread; one relaxed atomic each. The composition root owns the one object
// and reports it (a line when a limit is passed, at most once a minute each, and all figures at shut-down).
#pragma once

#include <array>
#include <atomic>
#include <cstddef>
#include <cstdint>
#include <map>
#include <string>
#include <string_view>
#include <utility>

#include "platform/base/Clock.h"
#include "platform/base/Mutex.h"

namespace kyt {

class Log;

enum class Reason : uint8_t {
  malformedMessage,  // a connection ended for breaking the protocol
  invalidArguments,  // a call answered InvalidArgs
  unentitledConnection,
  connectionAtTheEnd,  // refused since the daemon ends
  acceptFailed,        // times that the system refused to watch the listening socket, or to accept
  handshakeFailed,
  handshakeTimedOut,
  messageTimedOut,  // … or for a message of which the rest does not come
  messageTooLong,
  administrationRefused,  // a call at the administration socket by somebody who may not look
  tooManyConnections,
  tooManyConnectionsOfUser,
  tooManyDescriptorsOfUser,  // a connection refused, or ended with its message's descriptors
  userBytesExceeded,    // a connection or hierarchy token that its user's share of memory has no room for
  queuedBytesExceeded,  // reading from a client stopped
  clientNotReading,     // … and its connection ended
  aggregatorMessageDropped,
  sessionInfoKeyUnknown,     // an entry of the session's information that means nothing here
  sessionInfoValueMistyped,  // … whose value is of another type than its key's
  notConfigured,             // a message of a session before its configuration
  noStorebag,                // … whose configuration found no storebag
  noBackEnds,                // … whose storebag names no back end for it
  identifiersMissing,        // a single message without client type or session ID
  categoryOrTypeMissing,     // a message without one of them
  eventFiltered,             // an event that a back end's lists refuse when it is sent
  notForThisBackEnd,         // an event for a back end of a kind that sends none
  adaptorUnavailable,        // an event for an adaptor that is not there or does not take it
  datagramDisplaced,         // a datagram dropped because too many wait
  datagramUnacknowledged,    // … after its last retransmission
  datagramGivenUp,           // … with its back end
  batchFull,                 // an event dropped because its back end's batch is full
  userBatchesFull,           // … because its user's share of memory is
  // Decisions that a back end posts nothing, or nothing for now; the events count where they are dropped.
  consentMissing,
  countryNotListed,
  deviceNotListed,
  clientNotListed,
  samplingThresholdMissing,
  sampledOut,
  eventDroppedByState,   // a disabled back end dropped an event
  batchDiscarded,        // records discarded with a batch whose back end is not enabled
  batchedEventFiltered,  // records rejected by the lists at a flush
  // Of what stands in a post, each event, and each file or log data, counts.
  postWithoutURL,
  postWithoutPoster,  // the session was gone: nothing was sent
  postWithoutClientID,
  postFailed,       // ended with a transport error
  postRefused,      // answered 4xx or 5xx
  postRedirected,   // answered 3xx, which is not followed
  postDisplaced,    // dropped for newer ones while it waited for connectivity
  postWithoutRoom,  // too much of its session or user was not answered yet
  postCancelled,    // cut off by the end of the daemon
  // Of what the outbox had kept.
  outboxDisplaced,         // the oldest, for newer ones
  outboxTooOld,            // not taken by its server in time
  outboxConsentWithdrawn,  // collected by the owner's consent, which is no more
  outboxDropped,           // by the administrator
  outboxUnreadable,        // its file was damaged
  postNotKept,  // a post that failed and that the outbox could not keep; its events are lost as without one
  outboxFileDamaged,     // times that the outbox's file was set aside
  outboxPostUnreadable,  // posts that it had kept and that cannot be read any more
  requestFailed,         // the posts of events themselves
  requestRefused,
  requestRedirected,
  waitingRequestDisplaced,   // a request dropped while waiting for connectivity
  outstandingBytesExceeded,  // a request refused since too much of its session was not answered yet
  workersExhausted,          // work waited because all workers were in use
  sharedDataRefused,
  hierarchyTokenRefused,
  uploadTooLarge,
  tooMuchUploadedAtOnce,  // a file refused since others of its user fill what may be in memory
  customIdentifierRefused,
  badUserDefaultsFile,
  badEntitlementsFile,
  logLineDropped,        // nobody read standard error or the journal, and what may wait for that is full
  messageLogLineLost,    // no file could be made or written, or it is full
  messageLogShareUsed,   // a line of a user who has filled his part of the message log's file
  valueNotPostable,      // a record's value removed because JSON cannot carry it
  fileNotRemoved,        // an uploaded file that the broker could not or would not remove
  powerLogUnavailable,   // a power-log event without a journal to take it
  powerLogEventDropped,  // … for which there is no room, since the journal is slow or stopped
  numberOfReasons
};

[[nodiscard]] const char* reasonName(Reason reason);  // "malformed-message", for logs and tools

// The reasons that are fates: an event that is not delivered has exactly one of them in the books (Books.h). All others
// count something else (connections, requests, values, decisions), or copies of events.
inline constexpr std::array kFates = {
    Reason::notConfigured,
    Reason::noStorebag,
    Reason::noBackEnds,
    Reason::identifiersMissing,
    Reason::categoryOrTypeMissing,
    Reason::eventFiltered,
    Reason::notForThisBackEnd,
    Reason::adaptorUnavailable,
    Reason::batchFull,
    Reason::userBatchesFull,
    Reason::eventDroppedByState,
    Reason::batchDiscarded,
    Reason::batchedEventFiltered,
    Reason::postWithoutURL,
    Reason::postWithoutPoster,
    Reason::postWithoutClientID,
    Reason::postFailed,
    Reason::postRefused,
    Reason::postRedirected,
    Reason::postDisplaced,
    Reason::postWithoutRoom,
    Reason::postCancelled,
    Reason::outboxDisplaced,
    Reason::outboxTooOld,
    Reason::outboxConsentWithdrawn,
    Reason::outboxDropped,
    Reason::outboxUnreadable,
};
// Its place in kFates; kFates.size() for what is none.
[[nodiscard]] constexpr size_t fateNumber(Reason reason) {
  for (size_t i = 0; i < kFates.size(); ++i)
    if (kFates[i] == reason) return i;
  return kFates.size();
}

class Counters {
 public:
  void add(Reason reason, uint64_t count = 1) {
    values_[static_cast<size_t>(reason)].fetch_add(count, std::memory_order_relaxed);
  }
  [[nodiscard]] uint64_t value(Reason reason) const {
    return values_[static_cast<size_t>(reason)].load(std::memory_order_relaxed);
  }
  // add(), and whether a line about it may be written now (none was in the last minute).
  [[nodiscard]] bool addAndMayLog(Reason reason, MonotonicTime now, uint64_t count = 1);
  // Whether a line about that reason and this subject (a client, an address) may be written now: none was in the last
  // minute. For lines that tell a person why, which come once and not with each event. At most kMostSubjects are known
  // at a time; one beyond them is not told. Takes a lock and copies the subject: not for the road of each event.
  [[nodiscard]] bool mayTell(Reason reason, std::string_view subject, MonotonicTime now) EXCLUDES(toldMutex_);

 private:
  static constexpr size_t kMostSubjects = 1024;
  static constexpr size_t kReasons = static_cast<size_t>(Reason::numberOfReasons);
  std::array<std::atomic<uint64_t>, kReasons> values_{};
  std::array<std::atomic<int64_t>, kReasons> lastLogged_{};  // monotonic nanoseconds, 0: never
  Mutex toldMutex_;
  std::map<std::pair<Reason, std::string>, MonotonicTime> told_ GUARDED_BY(toldMutex_);
};

}  // namespace kyt
