// The one daemon-wide object: it accepts connections, keeps the list of live sessions and their hierarchies,
// the storebag cache and the data that hierarchies share, and serves as every session's delegate. It keeps a
// process transaction open exactly while a session is listed. The composition root owns it; it outlives every
// session.
//
// Threads: called on connections' queues. The containers are guarded by the agent's monitor, which is
// recursive and which sessions hold for the calls that say so; a storebag download happens while it is held,
// so that several sessions that need the same storebag download it once.
//
// Defined in several files by subject: ReportingdAgent.cpp (connections and the session list),
// …_Hierarchy.cpp, …_SharedData.cpp (shared data and the health report), …_Storebags.cpp.
#pragma once

#include <atomic>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "config/Configuration.h"
#include "daemon/HierarchyGroup.h"
#include "daemon/RefusedClients.h"
#include "daemon/SessionCensus.h"
#include "daemon/SharedDataStore.h"
#include "daemon/StorebagStandings.h"
#include "platform/base/Clock.h"
#include "platform/base/ConditionVariable.h"
#include "platform/base/Mutex.h"
#include "platform/ipc/Listener.h"
#include "platform/objects/Value.h"
#include "platform/queues/Monitor.h"
#include "session/ReportingdSessionDelegate.h"

namespace kyt {

class HealthReport;
class ProcessTransaction;
class ReportingdSession;
class ReportingdSessionClass;
class StorebagFetcher;

// How long a failed storebag fetch keeps from the next.
inline constexpr int32_t kStorebagRetrySeconds = 900;

class ReportingdAgent final : public ListenerDelegate, public ReportingdSessionDelegate {
 public:
  ReportingdAgent(Configuration configuration, StorebagFetcher& fetcher, ReportingdSessionClass& sessionClass,
                  ProcessTransaction& transaction);
  ~ReportingdAgent() override;
  ReportingdAgent(const ReportingdAgent&) = delete;
  ReportingdAgent& operator=(const ReportingdAgent&) = delete;

  bool listenerShouldAcceptNewConnection(Listener& listener,
                                         const std::shared_ptr<Connection>& connection) override;
  [[nodiscard]] std::shared_ptr<ReportingdSession> createReportingSessionWithDelegate(
      ReportingdSessionDelegate& delegate, const std::shared_ptr<Connection>& connection);
  void invalidateReportingSession(const std::shared_ptr<ReportingdSession>& session);

  // ReportingdSessionDelegate. All of these take the monitor themselves where they need it.
  [[nodiscard]] std::string description() const override;
  [[nodiscard]] Monitor& monitor() override { return monitor_; }
  std::optional<Dictionary> storebagForSession(ReportingdSession& session) override;
  std::optional<String> storebagVersionForSession(ReportingdSession& session) override;
  std::optional<AncestorIdentifiers> parentSessionIDStringForSession(ReportingdSession& session) override;
  void updateCorrelatedSessions(ReportingdSession& session) override;
  std::shared_ptr<ReportingdSession> getAncestorWithAggregatorForSession(ReportingdSession& session) override;
  void aggregationMayHaveChanged(ReportingdSession& session) override;
  void updateDownstreamSessions(ReportingdSession& session) override;
  std::shared_ptr<ReportingdSession> parentSessionForChild(ReportingdSession& session) override;
  void updateSharedDataForSession(ReportingdSession& session, const Dictionary& sharedData) override;
  void removeObjectFromSharedDataForSession(ReportingdSession& session, const String& key) override;
  std::optional<Dictionary> sharedDataForSession(ReportingdSession& session) override;
  void sessionFiguresMayHaveChanged(ReportingdSession& session) override;
  void addAgentHealthInfoForSession(ReportingdSession& session, Dictionary& payload) override;

  // Shut-down: refuses new connections and finishes those there are. Any thread, does not wait.
  void finishAllSessions();
  // Whether every session has ended, its final flush included, within `timeout` of real time.
  [[nodiscard]] bool waitUntilSessionsHaveEnded(Duration timeout);
  // Sessions listed now, and hierarchy tokens seen so far. Any thread, without the monitor.
  [[nodiscard]] size_t sessionCount() const { return sessionCount_.load(std::memory_order_relaxed); }
  [[nodiscard]] const StorebagStandings& storebags() const { return storebags_; }
  [[nodiscard]] size_t hierarchyTokenCount() const { return tokenCount_.load(std::memory_order_relaxed); }

 private:
  // Where a session is registered: under which token, at which place of its group.
  struct Registration {
    std::string token;
    uint64_t place = 0;
  };

  void tellRefusal(const Connection& connection);
  void tellUnshared(const ReportingdSession& session);
  void sessionWasInvalidated(const std::shared_ptr<ReportingdSession>& session);
  void removeFromGroups(ReportingdSession& session) REQUIRES(monitor_);
  [[nodiscard]] bool addGroup(const String& token, ReportingdSession& session) REQUIRES(monitor_);
  [[nodiscard]] const HierarchyGroup* group(const std::optional<String>& token) const REQUIRES(monitor_);
  [[nodiscard]] bool isIn(const HierarchyGroup& group, const String& token,
                          const ReportingdSession& session) const REQUIRES(monitor_);
  void refreshCensus() REQUIRES(monitor_);
  uint64_t addSessionHealthInfo(const ReportingdSession& session, HealthReport& healthReport)
      REQUIRES(monitor_);
  // Puts a new entry in the place of `existing`, that name's until now or null; returns the new one's section.
  std::optional<Dictionary> fetchAndCacheStorebag(int32_t clientType, const std::optional<String>& name,
                                                  const Dictionary* existing) REQUIRES(monitor_);
  [[nodiscard]] const Dictionary* cachedEntry(const std::optional<String>& name) const REQUIRES(monitor_);

  // Constant after construction.
  const Configuration configuration_;
  StorebagFetcher& fetcher_;
  ReportingdSessionClass& class_;
  ProcessTransaction& transaction_;

  Monitor monitor_;
  // By number, thus in the order of creation.
  std::map<uint64_t, std::shared_ptr<ReportingdSession>> _sessionList GUARDED_BY(monitor_);
  std::unordered_map<const ReportingdSession*, uint64_t> places_ GUARDED_BY(monitor_);  // in the list
  uint64_t nextPlace_ GUARDED_BY(monitor_) = 0;
  SessionCensus census_ GUARDED_BY(monitor_);
  Dictionary _cachedStorebags GUARDED_BY(monitor_);                   // storebag name to entry
  std::optional<uint32_t> cachedStorebagsSize_ GUARDED_BY(monitor_);  // the estimate, until the cache changes
  std::map<std::string, HierarchyGroup, std::less<>> _correlatedSessions GUARDED_BY(monitor_);
  std::unordered_map<const ReportingdSession*, Registration> registrations_ GUARDED_BY(monitor_);
  SharedDataStore _sharedData GUARDED_BY(monitor_);
  bool transactionOpen_ GUARDED_BY(monitor_) = false;

  // Self-synchronised.
  RefusedClients refusedClients_;
  StorebagStandings storebags_;
  std::atomic<size_t> sessionCount_{0};
  std::atomic<size_t> tokenCount_{0};
  std::atomic<bool> stopping_{false};

  // Sessions whose figures may have changed since the last health report. Compared, never followed.
  Mutex changedMutex_;
  std::vector<const ReportingdSession*> changedSessions_ GUARDED_BY(changedMutex_);

  Mutex endMutex_;
  ConditionVariable ended_;
  size_t unendedSessions_ GUARDED_BY(endMutex_) = 0;
};

}  // namespace kyt
