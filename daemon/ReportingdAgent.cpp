// Connections and the list of live sessions.
#include "daemon/ReportingdAgent.h"

#include <chrono>
#include <utility>

#include "platform/Platform.h"
#include "platform/ProcessTransaction.h"
#include "platform/base/Limits.h"
#include "platform/objects/Keys.h"
#include "platform/queues/Log.h"
#include "session/ReportingdSession.h"

namespace kyt {

ReportingdAgent::ReportingdAgent(Configuration configuration, StorebagFetcher& fetcher,
                                 ReportingdSessionClass& sessionClass, ProcessTransaction& transaction)
    : configuration_(configuration),
      fetcher_(fetcher),
      class_(sessionClass),
      transaction_(transaction),
      _sharedData(configuration.platform.budget) {}

ReportingdAgent::~ReportingdAgent() = default;

std::string ReportingdAgent::description() const {
  return "<ReportingdAgent>";
}

bool ReportingdAgent::listenerShouldAcceptNewConnection(Listener& /*listener*/,
                                                        const std::shared_ptr<Connection>& connection) {
  Log& log = configuration_.platform.log;
  if (stopping_) return false;
  if (!connection->entitlementValue(kEntitlement).boolValue()) {
    log.debug(
        "listener: new VRP connection %s does not have required kytreporting entitlement. Closing connection...",
        connection->description().c_str());
    tellRefusal(*connection);
    return false;
  }
  log.debug("listener: Accepting new VRP connection %s as it has proper entitlement, %d(%d) connections.",
            connection->description().c_str(), static_cast<int>(sessionCount()),
            static_cast<int>(hierarchyTokenCount()));

  const std::shared_ptr<ReportingdSession> session = createReportingSessionWithDelegate(*this, connection);
  connection->setExportedObject(session);
  // Both handlers show the session's description and not the connection's, deliberately: the lines of one
  // session are found by it. The connection drops the handlers after the invalidation, and with them its hold
  // on the session.
  connection->setInterruptionHandler([&log, session] {
    log.debug("listener: VRP connection to %s was interrupted", session->description().c_str());
  });
  connection->setInvalidationHandler([this, session] { sessionWasInvalidated(session); });
  connection->resume();
  // A shut-down that began meanwhile may have looked at the list before this session stood in it.
  if (stopping_) connection->finish();
  return true;
}

// The line above is seen at the debug level alone, where an administrator who misses events does not look.
void ReportingdAgent::tellRefusal(const Connection& connection) {
  const Platform& platform = configuration_.platform;
  const uint32_t user = connection.peerUser();
  if (platform.log.debugEnabled() || !refusedClients_.mayTell(user, platform.clock.monotonic())) return;
  platform.log.normal(
      "listener: Refused connection %s: no grant gives it the entitlement, see \"kytctl entitlements check --user %u\"",
      connection.description().c_str(), user);
}

std::shared_ptr<ReportingdSession> ReportingdAgent::createReportingSessionWithDelegate(
    ReportingdSessionDelegate& delegate, const std::shared_ptr<Connection>& connection) {
  std::shared_ptr<ReportingdSession> session =
      ReportingdSession::initWithSessionDelegate(delegate, connection, class_);
  {
    MutexLock lock(endMutex_);
    ++unendedSessions_;
  }
  MonitorLock lock(monitor_);
  if (_sessionList.empty() && !transactionOpen_) {
    transaction_.begin();
    transactionOpen_ = true;
  }
  const uint64_t place = nextPlace_++;
  _sessionList.emplace(place, session);
  places_.emplace(session.get(), place);
  census_.set(place, session->clientType(), session->batchedEventsSize());
  sessionCount_.store(_sessionList.size(), std::memory_order_relaxed);
  return session;
}

void ReportingdAgent::sessionWasInvalidated(const std::shared_ptr<ReportingdSession>& session) {
  configuration_.platform.log.debug("listener: VRP connection to %s was invalidated",
                                    session->description().c_str());
  invalidateReportingSession(session);
  session->dealloc();
  // Notified while locked: the shut-down that waits for this destroys the agent next.
  MutexLock lock(endMutex_);
  --unendedSessions_;
  ended_.notifyAll();
}

void ReportingdAgent::invalidateReportingSession(const std::shared_ptr<ReportingdSession>& session) {
  MonitorLock lock(monitor_);
  const std::optional<String> token = session->hierarchyToken();
  // From where it is registered, which is the array of an earlier token when the client dropped its token
  // later.
  removeFromGroups(*session);
  // The count is that of all tokens and not of this one's sessions, deliberately. While the token's own entry
  // exists it is never zero, so a token's array and shared data stay for the life of the process: sessions of
  // one hierarchy may come and go without losing what they share.
  if (token && _correlatedSessions.count(token->view()) != 0 && _correlatedSessions.empty()) {
    _correlatedSessions.erase(token->str());
    _sharedData.removeToken(*token);
  }
  const auto place = places_.find(session.get());
  if (place != places_.end()) {
    census_.remove(place->second);
    _sessionList.erase(place->second);
    places_.erase(place);
  }
  sessionCount_.store(_sessionList.size(), std::memory_order_relaxed);
  if (_sessionList.empty() && transactionOpen_) {
    transactionOpen_ = false;
    transaction_.end();
  }
}

void ReportingdAgent::finishAllSessions() {
  std::vector<std::shared_ptr<Connection>> connections;
  stopping_ = true;
  {
    MonitorLock lock(monitor_);
    connections.reserve(_sessionList.size());
    for (const auto& [place, session] : _sessionList) connections.push_back(session->connection());
  }
  for (const auto& connection : connections)
    if (connection != nullptr) connection->finish();
}

bool ReportingdAgent::waitUntilSessionsHaveEnded(Duration timeout) {
  const MonotonicTime end = std::chrono::steady_clock::now() + timeout;
  MutexLock lock(endMutex_);
  while (unendedSessions_ != 0)
    if (!ended_.waitUntil(endMutex_, end)) return unendedSessions_ == 0;
  return true;
}

}  // namespace kyt
