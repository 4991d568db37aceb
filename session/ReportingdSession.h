// The daemon's side of one reporting session that a client opened: it configures its back ends from the
// storebag, decides which of them gets a message, fans flushes and uploads out to them, keeps their states in
// step with its parent session, and reports its own start and end as internal messages. The agent makes one
// for each accepted connection; the connection keeps it as its exported object until it is invalidated.
//
// Threads: the client's calls and dealloc() run on the connection's queue, one at a time. Sessions of one
// hierarchy reach into each other while holding the agent's monitor. So fields of the second group below are
// written only on the connection's queue, by a session that was ever in a hierarchy while holding the monitor, are
// read there without it, and elsewhere only while holding it; those of the last group are touched on the
// connection's queue alone.
//
// What a client, the agent, back ends and other sessions of the hierarchy ask of it is a contract, and most of it reads
// and writes the same states; so it is one class with more operations and fields than others have.
//
// Defined in several files by subject: ReportingdSession.cpp (lifecycle and configuration), …_Routing.cpp
// (the two doors for messages), …_Flush.cpp (flush, uploads, log data), …_States.cpp (states, hierarchy,
// aggregation).
#pragma once

#include <array>
#include <atomic>
#include <bitset>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "backend/BackendFactory.h"
#include "config/DeviceIdentity.h"
#include "platform/base/Books.h"
#include "platform/base/Clock.h"
#include "platform/base/Counters.h"
#include "platform/base/UserBudget.h"
#include "platform/ipc/ClientSessionInterface.h"
#include "platform/ipc/Listener.h"
#include "platform/objects/Value.h"
#include "session/ReportingdSessionClass.h"
#include "session/ReportingdSessionDelegate.h"

namespace kyt {

class ReportingSessionConnectivityHelper;

class ReportingdSession final : public ClientSessionInterface,
                                private AnswerReader,
                                public std::enable_shared_from_this<ReportingdSession> {
 public:
  // Never fails. The delegate and the class outlive the session; the connection is held until dealloc().
  [[nodiscard]] static std::shared_ptr<ReportingdSession> initWithSessionDelegate(
      ReportingdSessionDelegate& delegate, std::shared_ptr<Connection> connection,
      ReportingdSessionClass& sessionClass);
  ~ReportingdSession() override;
  ReportingdSession(const ReportingdSession&) = delete;
  ReportingdSession& operator=(const ReportingdSession&) = delete;

  // The end of the session: the stop message, the final flush, the end of aggregation, and the clean-up of
  // its back ends. Exactly once, on the connection's queue after its invalidation, with no lock held and
  // after the agent has taken the session out of its list.
  void dealloc();

  // What the client calls.
  void setSessionInfo(Dictionary sessionInfo, std::optional<Dictionary> userInfo, Value frameworksToCheck,
                      bool hasAggregationBlock) override;
  void startConfigWithCompletionHandler(StatesReply reply) override;
  void fetchStatesWithUserInfo(std::optional<Dictionary> userInfo, StatesReply reply) override;
  void fetchDisplayURL(StringReply reply) override;
  void sendMessageWithDictionary(Dictionary message, ObjectReply reply) override;
  void flushMessagesWithCompletion(ResultReply completion) override;
  void finishSessionGracefully() override;
  void uploadFileAtPath(String fileURL, String extensionToken, std::optional<FileExtension> extension,
                        SuccessReply completionHandler) override;
  void uploadLogData(Value logData, SuccessErrorReply completionHandler) override;
  void sendMessageWithSessionInfo(Dictionary sessionInfo, std::optional<Dictionary> userInfo,
                                  uint16_t category, uint16_t type, std::optional<Dictionary> payload,
                                  StringReply reply) override;
  void updateSharedDataWithDictionary(Dictionary sharedData) override;
  void updateSharedDataForKey(String key, Value value) override;
  void setDigestKey(Data key, int32_t algorithm) override;

  // What the agent and other sessions of the hierarchy call, holding the agent's monitor.
  void syncReportingStates();
  void updateCombinedSessionID();
  void sendToAggregator(const std::optional<Dictionary>& sessionInfo, double timestamp, uint16_t category,
                        uint16_t type, const std::optional<Dictionary>& payload);
  void shutdownSessionAggregation();
  [[nodiscard]] uint64_t batchedEventsSize() const;
  [[nodiscard]] uint32_t hierarchyLevel() const;
  // The token's identifier. A text is itself; other kinds count by their description.
  [[nodiscard]] std::optional<String> hierarchyToken() const;
  // The agent refused the session's hierarchy token: it has none from now on.
  void becomeStandalone();
  // For the agent's lists, which own their sessions.
  [[nodiscard]] std::shared_ptr<ReportingdSession> shared() { return shared_from_this(); }
  // None after dealloc().
  [[nodiscard]] const std::shared_ptr<Connection>& connection() const { return _connection; }
  [[nodiscard]] uint32_t sessionID() const { return _sessionID; }
  void setSessionID(uint32_t sessionID) { _sessionID = sessionID; }
  [[nodiscard]] const std::optional<Dictionary>& sessionInfo() const { return _sessionInfo; }
  [[nodiscard]] bool wasInHierarchy() const { return wasInHierarchy_; }
  [[nodiscard]] bool hasAggregator() const { return _hasAggregator.load(std::memory_order_relaxed); }
  void setHasAggregator(bool value);
  [[nodiscard]] KYTReportingBackend* backendForKey(std::string_view key) const { return _backends.find(key); }

  // Of the session information; 0 without any. Any thread.
  [[nodiscard]] int32_t clientType() const { return clientType_.load(std::memory_order_relaxed); }
  // The health report asks for the client type and the batches' size next: later changes are told again.
  void figuresAreRead() { figuresChanged_.exchange(false); }

  // On the connection's queue.
  void updateReportingStates();
  [[nodiscard]] std::optional<Array> fetchReportingStates() const;
  [[nodiscard]] const std::optional<Dictionary>& userInfo() const { return _userInfo; }
  [[nodiscard]] const std::optional<String>& storebagVersion() const { return _storebagVersion; }
  void setStorebagVersion(std::optional<String> version) { _storebagVersion = std::move(version); }

  // Any thread: constant.
  [[nodiscard]] const String& sessionIDString() const { return _sessionIDString; }
  [[nodiscard]] uint32_t peerUser() const { return peerUser_; }
  [[nodiscard]] std::string description() const;

 private:
  ReportingdSession(ReportingdSessionDelegate& delegate, std::shared_ptr<Connection> connection,
                    ReportingdSessionClass& sessionClass);

  // Lifecycle and configuration.
  void takeOverIdentity(const Dictionary& sessionInfo);
  void figuresMayHaveChanged();
  void countInformation();
  void identifyProgram();
  void publishIdentity();
  void publishBackends();
  void createBackendsWithStorebag(const Dictionary& storebag);
  void updateSessionWithDefaultSessionInfo();
  void sendStartMessage();
  void receivedUserInfo(const std::optional<Dictionary>& userInfo);
  void updateUserInfoForBackends();
  [[nodiscard]] bool requiresUserInfo() const;
  // A table that yielded no back end counts as no back ends.
  [[nodiscard]] bool hasBackends() const { return !_backends.empty(); }

  // Routing.
  Value sendMessageWithDictionaryError(Dictionary message);
  void internalSendMessage(std::optional<Dictionary> payload, const TimeValue& timestamp, uint16_t method,
                           uint16_t respCode);
  [[nodiscard]] Dictionary envelopeWithPayload(std::optional<Dictionary> payload);
  // An event that no back end gets.
  void dropEvent(Reason fate, EventKind kind);
  // At the default level, once for a reason in the session's life, and once a minute for its user and client type.
  void tellDrop(Reason reason, const std::string& why);
  void tellFiltered(const KYTReportingBackend& backend, uint16_t category);
  void tellOddNumbers(const Value& category, const Value& type);
  Value routeToBackends(Dictionary envelope, const TimeValue& timestamp, uint16_t category, uint16_t type,
                        MessageFlag flag);

  // The client that waits for an answer, or else the message log.
  [[nodiscard]] bool wantsAnswer(size_t leastBytes) override;

  // Flush and uploads.
  void internalFlushMessagesWithCompletion(ResultReply completion);
  void uploadFileWithURL(const String& fileURL, const String& extensionToken,
                         std::optional<FileExtension> extension, SuccessReply completionHandler);

  // Aggregation.
  void aggregateMessage(const std::optional<Dictionary>& sessionInfo, double timestamp, uint16_t category,
                        uint16_t type, const Dictionary* payload);

  [[nodiscard]] Platform& platform() const { return class_.platform(); }
  [[nodiscard]] Log& log() const;
  [[nodiscard]] Counters& counters() const;

  // Constant after construction.
  ReportingdSessionClass& class_;
  ReportingdSessionDelegate& _sessionDelegate;
  String _sessionIDString;  // base64 of a random UUID
  std::array<char, kDeviceIDSize> _deviceid{};
  uint32_t peerUser_;
  std::shared_ptr<UserAccount> userAccount_;

  // Written on the connection's queue while holding the monitor. The first three without it by a session that never
  // was in a hierarchy: nobody else looks at them.
  uint32_t _sessionID = 0;
  std::optional<Dictionary> _sessionInfo;
  std::optional<Dictionary> _hierarchyDictionary;
  Backends _backends;
  std::shared_ptr<Connection> _connection;
  std::atomic<bool> _hasAggregator{false};  // cleared by other sessions too, holding the monitor

  // Synchronised by themselves.
  std::atomic<int32_t> clientType_{0};
  std::atomic<bool> figuresChanged_{false};  // and told
  std::atomic<bool> wasInHierarchy_{false};  // a session that drops its token stays where it is registered

  // Touched on the connection's queue alone.
  std::shared_ptr<SessionStanding> standing_;  // until dealloc()
  std::optional<Dictionary> _userInfo;
  Value _frameworks;             // kept for the session's life; nothing here reads it
  Dictionary _periodicServices;  // nothing here fills it
  std::optional<String> _storebagVersion;
  Reason withoutBackends_ = Reason::notConfigured;  // why a message finds no back end, when it finds none
  std::bitset<static_cast<size_t>(Reason::numberOfReasons)> toldDrops_;
  bool toldOddNumbers_ = false;
  bool isAnswerAwaited_ = false;  // of the call that is being served
  // The books: whose events these are, and those that no back end got, as KYTReportingBackend keeps them.
  std::shared_ptr<const ReportingProgram> program_;
  std::array<std::shared_ptr<Tally>, 2> withoutBackend_;
  bool sendsInternalMessage_ = false;
  bool _hasFinishedGracefully = false;
  std::optional<Data> _digestKey;
  const int32_t _digestAlgorithm = 0;  // never assigned, deliberately: see setDigestKey()
  std::shared_ptr<ReportingSessionConnectivityHelper> _connectivityHelper;
  Charge information_;  // for what the client said about itself
  bool ended_ = false;
};

}  // namespace kyt
