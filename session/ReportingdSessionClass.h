// What all sessions of the process share: the lock of the class ReportingdSession, the connectivity helper of
// single messages, and the services that every session needs. The composition root owns the one object; it
// outlives every session and every completion of a flush.
//
// The lock guards the flush fan-ins' counters and the making of the shared helper. It is taken last but for a
// connection's output lock, and nothing blocks while it is held.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>

#include "config/Configuration.h"
#include "platform/base/Books.h"
#include "platform/base/Mutex.h"
#include "platform/objects/Value.h"
#include "session/SessionStanding.h"

namespace kyt {

// The books' name of a session's program: its user, its client type and the names in its user information.
[[nodiscard]] ReportingProgram programOf(uint32_t user, int32_t clientType,
                                         const std::optional<Dictionary>& userInfo);

class BackendFactory;
class KYTReportingBackend;
class MessageLog;
class ReportingSessionConnectivityHelper;
class UserAccount;

class ReportingdSessionClass {
 public:
  ReportingdSessionClass(Configuration configuration, BackendFactory& backendFactory, MessageLog& messageLog);
  ~ReportingdSessionClass();
  ReportingdSessionClass(const ReportingdSessionClass&) = delete;
  ReportingdSessionClass& operator=(const ReportingdSessionClass&) = delete;

  [[nodiscard]] Platform& platform() const { return configuration_.platform; }
  [[nodiscard]] DeviceIdentity& deviceIdentity() const { return configuration_.deviceIdentity; }
  [[nodiscard]] BackendFactory& backendFactory() const { return backendFactory_; }
  [[nodiscard]] MessageLog& messageLog() const { return messageLog_; }
  // How all sessions stand. Any thread.
  [[nodiscard]] SessionStandings& standings() { return standings_; }
  [[nodiscard]] Mutex& lock() RETURN_CAPABILITY(lock_) { return lock_; }

  // Sends one event without a configured session: builds back ends for it alone and discards them afterwards.
  // Runs on the caller's queue. `user`: whose client sends it. What it takes counts towards `account`; null: towards
  // nobody's.
  void sendMessageWithSessionInfo(uint32_t user, const std::optional<Dictionary>& sessionInfo,
                                  const std::optional<Dictionary>& userInfo,
                                  const std::optional<Dictionary>& storebag, uint16_t category, uint16_t type,
                                  const std::optional<Dictionary>& payload,
                                  const std::shared_ptr<UserAccount>& account = nullptr);

  // Of an event that no back end took: whoever watches is told.
  void tellWatchers(const Tally& tally, EventKind kind, Reason fate) const;

  // Made at first use; shared by all single messages.
  [[nodiscard]] std::shared_ptr<ReportingSessionConnectivityHelper> singleMessageHelper();

 private:
  void dropEvent(const ReportingProgram& program, EventKind kind, Reason fate) const;
  void tellFiltered(const KYTReportingBackend& backend, uint16_t category) const;
  Configuration configuration_;
  BackendFactory& backendFactory_;
  MessageLog& messageLog_;
  SessionStandings standings_;
  Mutex lock_;
  std::shared_ptr<ReportingSessionConnectivityHelper> singleMessageHelper_ GUARDED_BY(lock_);
};

}  // namespace kyt
