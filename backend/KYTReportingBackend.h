// The common base and the interface of all back ends: the objects to which a reporting session hands its
// clients' events, files and log data. Created only by the factory (backend/BackendFactory.h), owned by one
// session in a dictionary keyed by name; `cleanup` is called before the last reference goes. shared_ptr,
// because replies that arrive on a URL session's queue hold their back end weakly.
//
// Threads: called on the owning session's queue; `state`, the sampling threshold and the combined session ID,
// which other sessions of a hierarchy change, and what a subclass says so are kept by the private state
// queue. What a back end is told when it is made (SessionFacts) is constant. Code that runs on the state queue uses
// the functions whose names end in OnQueue. Work that is handed to the state queue holds no reference, so a subclass
// whose work touches its own fields calls drainStateQueue() in its destructor.
//
// Its operations and properties are a contract with the sessions, so it has more than other classes.
#pragma once

#include <array>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include "backend/BackEndStanding.h"
#include "backend/ReportingSessionConnectivityInterface.h"
#include "backend/SessionFacts.h"
#include "backend/SessionIDPath.h"
#include "platform/FileExtension.h"
#include "platform/URLSession.h"
#include "platform/base/Books.h"
#include "platform/base/Clock.h"
#include "platform/base/Departures.h"
#include "platform/base/Error.h"
#include "platform/base/Function.h"
#include "platform/base/Mutex.h"
#include "platform/objects/Value.h"
#include "platform/queues/SerialQueue.h"

namespace kyt {

class UserAccount;
struct Platform;

// Two numbers that would otherwise be mistaken for each other in the send operations.
enum class EventID : uint16_t {};
enum class MessageFlag : int32_t {};

// The whole values that mean something; the tests are on whole values, not on single bits.
[[nodiscard]] constexpr bool isRealtime(MessageFlag flag) {
  return flag == MessageFlag{1} || flag == MessageFlag{3};
}
[[nodiscard]] constexpr bool isExpedite(MessageFlag flag) {
  return flag == MessageFlag{2} || flag == MessageFlag{3};
}

// Delivery states. The session reports kEnabled and kHeld as live.
inline constexpr int32_t kBackendStateUndecided = 0;
inline constexpr int32_t kBackendStateDisabled = 1;
inline constexpr int32_t kBackendStateEnabled = 2;
inline constexpr int32_t kBackendStateHeld = 3;  // held by sampling

// (result, error); a back end that has nothing to say calls it with neither.
using FlushCompletion = Function<void(Value result, std::optional<Error> error)>;

// Whoever hands on what back ends return: their session. Asked on its queue, before a long text is made.
class AnswerReader {
 public:
  virtual ~AnswerReader() = default;
  // Whether anybody gets a text of at least so many bytes. What nobody gets has been counted then, where that is due.
  [[nodiscard]] virtual bool wantsAnswer(size_t leastBytes) = 0;
};

// Whether a white or black list of the storebag names the category.
[[nodiscard]] bool holdsCategory(const Array& list, uint16_t category);

class KYTReportingBackend : public std::enable_shared_from_this<KYTReportingBackend> {
 protected:
  // What a constructor asks for, so that only classes of back ends can make one, through an initWithName(...) that
  // returns null on failure, and std::make_shared can call it.
  struct Making {
    explicit Making() = default;
  };

 public:
  // The base alone: a back end that does nothing.
  static std::shared_ptr<KYTReportingBackend> initWithName(Platform& platform, String name,
                                                           Dictionary profile, SharedSessionFacts facts);
  // Draws the sampling factor (one of 0.00, 0.01, … 1.00, equally likely).
  KYTReportingBackend(Making, Platform& platform, String name, Dictionary profile, SharedSessionFacts facts);
  KYTReportingBackend(const KYTReportingBackend&) = delete;
  KYTReportingBackend& operator=(const KYTReportingBackend&) = delete;
  virtual ~KYTReportingBackend();

  // 64 lower-case hexadecimal digits of the SHA-256 of the text's UTF-8 bytes, of which only as many are
  // hashed as the text has UTF-16 code units: for text outside ASCII a prefix, deliberately, since servers
  // compare with such digests.
  [[nodiscard]] String convertIntoSHA256(const String& text) const;

  virtual void cleanup();
  // Of the user whose events these are: what is kept for them counts there. Before the first event.
  void setUserAccount(std::shared_ptr<UserAccount> account) { userAccount_ = std::move(account); }
  // It outlives the back end. Null, as at first: every text is wanted.
  void setAnswerReader(AnswerReader* reader) { answerReader_ = reader; }
  void setReportingSessionConnectivityDelegate(std::weak_ptr<ReportingSessionConnectivityInterface> delegate);

  // The books. Whose events come next; null, as at first: they are counted, and not booked.
  void setProgram(std::shared_ptr<const ReportingProgram> program);
  // Before each event, whatever becomes of it. `isInternal`: a message of the daemon's own.
  void takeEvent(bool isInternal, EventKind kind = {});
  // The event that was taken last.
  void dropEvent(Reason fate) const { dropEvent(tally_, kind_, fate); }

  // Read synchronously, written asynchronously on the state queue, so every read sees the writes issued
  // before it.
  [[nodiscard]] int32_t state() const;
  // `rule`: what decided it, and the status of the server's answer, if that did.
  void setState(int32_t state, StateRule rule = StateRule::none, int status = 0);
  virtual void updateState();
  // Any thread; it outlives the back end for whoever has it.
  [[nodiscard]] const std::shared_ptr<BackEndStanding>& standing() const { return standing_; }

  // The operation that every event goes through. The returned text goes into the local message log and into the reply; it
  // may be missing where the answer reader wants none. The message comes by
  // value, so that the last of several back ends may make its record of it instead of copying it.
  virtual Value sendMessage(Dictionary message, const TimeValue& timestamp, uint16_t method,
                            uint16_t respCode, EventID eventID, MessageFlag flag);
  // An operation of its own: back ends that implement only this one are not reached by routed events.
  virtual Value sendMessage(const Dictionary& message, const TimeValue& timestamp, uint16_t method,
                            uint16_t respCode, EventID eventID);
  // Numbers the event (1 for the first, 0 after 65535) and passes it to the six-argument operation.
  Value sendMessage(Dictionary message, const TimeValue& timestamp, uint16_t method, uint16_t respCode,
                    MessageFlag flag);

  virtual Value flushMessagesWithCompletion(FlushCompletion completion);
  // `offer` has the descriptors that came with the token; a back end that uploads files takes them.
  [[nodiscard]] virtual bool uploadFileAtPath(const String& path, const String& extensionToken,
                                              FileOffer& offer);
  [[nodiscard]] virtual bool uploadLogData(const Value& logData);
  virtual void setCorrelatedSessionID(const SessionIDPath& sessionID);
  // Without a list everything is allowed; an empty list allows nothing.
  [[nodiscard]] bool isWhitelistedEvent(uint16_t category) const;
  [[nodiscard]] bool isBlacklistedEvent(uint16_t category) const;
  [[nodiscard]] virtual uint64_t batchedEventsSize();

  // Plain properties.
  [[nodiscard]] const String& name() const { return name_; }
  [[nodiscard]] const Dictionary& profile() const { return profile_; }
  [[nodiscard]] const SessionFacts& facts() const { return *facts_; }
  // Whether events are batched now: what the session asked for, unless the storebag says otherwise.
  [[nodiscard]] bool batchEvents() const { return batchEvents_; }
  void setBatchEvents(bool value) { batchEvents_ = value; }
  // Read and written synchronously on the state queue: the agent sets it from another session's thread.
  [[nodiscard]] std::optional<String> combinedSessionIDString() const;
  void setCombinedSessionIDString(std::optional<String> value);
  [[nodiscard]] const std::optional<String>& displayURL() const { return displayURL_; }
  void setDisplayURL(std::optional<String> value) { displayURL_ = std::move(value); }
  [[nodiscard]] const std::optional<Dictionary>& userInfoDict() const { return userInfoDict_; }
  virtual void setUserInfoDict(std::optional<Dictionary> value) { userInfoDict_ = std::move(value); }
  [[nodiscard]] double samplingFactor() const { return samplingFactor_; }
  // A number, or null. On the state queue like the combined session ID: children copy their parent's.
  [[nodiscard]] Value samplingThreshold() const;
  void setSamplingThreshold(Value value);
  [[nodiscard]] const std::optional<Data>& digestKey() const { return digestKey_; }
  void setDigestKey(std::optional<Data> value) { digestKey_ = std::move(value); }
  [[nodiscard]] int32_t digestAlgorithm() const { return digestAlgorithm_; }
  void setDigestAlgorithm(int32_t value) { digestAlgorithm_ = value; }

 protected:
  [[nodiscard]] Platform& platform() const { return platform_; }
  [[nodiscard]] const SharedSessionFacts& sharedFacts() const { return facts_; }
  [[nodiscard]] std::shared_ptr<ReportingSessionConnectivityInterface> connectivityDelegate() const {
    return reportingSessionConnectivityDelegate_.lock();
  }
  [[nodiscard]] const std::shared_ptr<UserAccount>& userAccount() const { return userAccount_; }
  [[nodiscard]] bool isAnswerWanted(size_t leastBytes) const {
    return answerReader_ == nullptr || answerReader_->wantsAnswer(leastBytes);
  }
  // The books' side of the event that was taken last; null: it is not booked. It lives until the next setProgram(), which
  // waits for what stands on the state queue.
  [[nodiscard]] Tally* tally() const { return tally_; }
  void dropEvent(Tally* tally, EventKind kind, Reason fate) const;
  // Why this back end drops events for that reason: the list, or the rule of its state. Empty: the reason says all.
  [[nodiscard]] const char* ruleFor(Reason fate, EventKind kind) const;
  [[nodiscard]] EventKind eventKind() const { return kind_; }  // of the event that was taken last
  void eventDelivered() const;
  // The answer to the upload of a file or of log data, for the owner of the device. The session's queue.
  void tellOwner(DepartureKind kind, std::string_view address, size_t bytes, const URLReply& reply) const;
  // Of the latest event.
  [[nodiscard]] uint16_t eventNumber() const { return eventID_; }
  void setEventWhitelist(std::optional<Array> list) { eventWhitelist_ = std::move(list); }
  void setEventBlacklist(std::optional<Array> list) { eventBlacklist_ = std::move(list); }
  [[nodiscard]] SerialQueue& stateQueue() const RETURN_CAPABILITY(*stateQueue_) { return *stateQueue_; }
  [[nodiscard]] int32_t stateOnQueue() const REQUIRES(stateQueue()) { return state_; }
  [[nodiscard]] const std::optional<SessionIDPath>& combinedSessionIDOnQueue() const REQUIRES(stateQueue()) {
    return combinedSessionID_;
  }
  void setCombinedSessionIDOnQueue(const SessionIDPath& sessionID) REQUIRES(stateQueue()) {
    combinedSessionID_ = sessionID;
  }
  // Runs what was handed to the state queue and has not begun.
  void drainStateQueue();
  // A random identifier that stays the same on this device, created on first use. Reports that respect the user's consent
  // have one, reports that override it another.
  [[nodiscard]] String getPersistentIdentifierForDNU(bool respectDnu);

 private:
  Platform& platform_;
  const String name_;
  const Dictionary profile_;
  const SharedSessionFacts facts_;
  const double samplingFactor_;
  const std::shared_ptr<SerialQueue> stateQueue_;
  const std::shared_ptr<BackEndStanding> standing_;

  // The session's queue.
  uint16_t eventID_ = 0;
  bool batchEvents_;
  std::optional<String> displayURL_;
  std::optional<Dictionary> userInfoDict_;
  std::optional<Array> eventWhitelist_, eventBlacklist_;
  std::optional<Data> digestKey_;
  int32_t digestAlgorithm_ = 0;
  std::shared_ptr<UserAccount> userAccount_;
  AnswerReader* answerReader_ = nullptr;
  std::shared_ptr<const ReportingProgram> program_;
  std::array<std::shared_ptr<Tally>, 2>
      tallies_;             // its events, and the daemon's own; opened by the first of each
  Tally* tally_ = nullptr;  // one of them
  EventKind kind_;
  std::weak_ptr<ReportingSessionConnectivityInterface> reportingSessionConnectivityDelegate_;

  void tellWatchers(const Tally& tally, EventKind kind, std::optional<Reason> dropped) const;

  int32_t state_ GUARDED_BY(*stateQueue_) = kBackendStateUndecided;
  std::optional<SessionIDPath> combinedSessionID_ GUARDED_BY(*stateQueue_);
  Value samplingThreshold_ GUARDED_BY(*stateQueue_);
};

}  // namespace kyt
