// The data that the sessions of a hierarchy share, and the figures about the whole daemon. Nothing unbounded
// is kept for clients: what a user shares is limited (daemon/SharedDataStore.h).
#include "daemon/HealthReport.h"
#include "daemon/ReportingdAgent.h"
#include "platform/Platform.h"
#include "platform/base/Counters.h"
#include "platform/base/Limits.h"
#include "platform/objects/MemoryInfo.h"
#include "platform/objects/ObjectSize.h"
#include "platform/queues/Log.h"
#include "session/ReportingdSession.h"

namespace kyt {

void ReportingdAgent::updateSharedDataForSession(ReportingdSession& session, const Dictionary& sharedData) {
  Platform& platform = configuration_.platform;
  MonitorLock lock(monitor_);
  const std::optional<String> token = session.hierarchyToken();
  if (!token) return tellUnshared(session);
  if (_sharedData.update(*token, sharedData, session.peerUser())) return;
  if (platform.counters.addAndMayLog(Reason::sharedDataRefused, platform.clock.monotonic()))
    platform.log.error(
        "updateSharedDataForSession: User %u shares %llu bytes, too many for the update of session %u",
        session.peerUser(), static_cast<unsigned long long>(_sharedData.bytesOfUser(session.peerUser())),
        session.sessionID());
}

// Nobody shares with a session that belongs to no hierarchy.
void ReportingdAgent::tellUnshared(const ReportingdSession& session) {
  Platform& platform = configuration_.platform;
  platform.counters.add(Reason::sharedDataRefused);
  const std::string user = std::to_string(session.peerUser());
  if (!platform.counters.mayTell(Reason::sharedDataRefused, user, platform.clock.monotonic())) return;
  platform.log.normal(
      "updateSharedDataForSession: Session %u of user %s shares data and has no hierarchy token, it is left out",
      session.sessionID(), user.c_str());
}

void ReportingdAgent::removeObjectFromSharedDataForSession(ReportingdSession& session, const String& key) {
  MonitorLock lock(monitor_);
  if (const std::optional<String> token = session.hierarchyToken()) _sharedData.removeObject(*token, key);
}

std::optional<Dictionary> ReportingdAgent::sharedDataForSession(ReportingdSession& session) {
  MonitorLock lock(monitor_);
  const std::optional<String> token = session.hierarchyToken();
  return token ? _sharedData.dictionary(*token) : std::nullopt;
}

void ReportingdAgent::sessionFiguresMayHaveChanged(ReportingdSession& session) {
  MutexLock lock(changedMutex_);
  changedSessions_.push_back(&session);
}

// A session may have left the list since it told of a change, or even be gone: only listed ones are looked at.
void ReportingdAgent::refreshCensus() {
  std::vector<const ReportingdSession*> changed;
  {
    MutexLock lock(changedMutex_);
    changed.swap(changedSessions_);
  }
  for (const ReportingdSession* session : changed) {
    const auto place = places_.find(session);
    if (place == places_.end()) continue;
    ReportingdSession& listed = *_sessionList.at(place->second);
    listed.figuresAreRead();
    census_.set(place->second, listed.clientType(), listed.batchedEventsSize());
  }
}

uint64_t ReportingdAgent::addSessionHealthInfo(const ReportingdSession& session, HealthReport& healthReport) {
  const uint64_t size = session.batchedEventsSize();
  healthReport.addSession(session.clientType(), size);
  return size;
}

// The session that asks is added once more in the end. Asked for a listed session, the report counts it
// twice, deliberately: the servers' figures have always been read that way.
void ReportingdAgent::addAgentHealthInfoForSession(ReportingdSession& session, Dictionary& payload) {
  Platform& platform = configuration_.platform;
  MonitorLock lock(monitor_);
  HealthReport report;
  refreshCensus();
  uint64_t batchedEvents = census_.addTo(report);
  batchedEvents += addSessionHealthInfo(session, report);
  report.write(payload);
  if (!cachedStorebagsSize_) cachedStorebagsSize_ = objectSizeEstimate(_cachedStorebags, platform.memory);
  payload.set("StorebagsCount", static_cast<uint64_t>(_cachedStorebags.size()));
  payload.set("StorebagsSize", *cachedStorebagsSize_);
  payload.set("CalculatedMemoryUsage", batchedEvents + *cachedStorebagsSize_);
  payload.set("ProcessMemoryUsage", platform.memory.internalMemory());
}

}  // namespace kyt
