// The data that the sessions of a hierarchy share, and the figures about the whole daemon. Nothing unbounded
// is kept for clients: what a user shares is limited (daemon/SharedDataStore.h).
#include "daemon/HealthReport.h"
#include "daemon/ReportingdAgent.h"
#include "platform/Counters.h"
#include "platform/Keys.h"
#include "platform/Limits.h"
#include "platform/Log.h"
#include "platform/ObjectSize.h"
#include "platform/Platform.h"
#include "platform/System.h"
#include "session/ReportingdSession.h"

namespace kyt {

void ReportingdAgent::updateSharedDataForSession(ReportingdSession& session, const Dictionary& sharedData) {
  Platform& platform = configuration_.platform;
  MonitorLock lock(monitor_);
  const std::optional<String> token = session.hierarchyToken();
  if (!token) return;
  if (_sharedData.update(*token, sharedData, session.peerUser())) return;
  if (platform.counters.addAndMayLog(Reason::sharedDataRefused, platform.clock.monotonic()))
    platform.log.error(
        "updateSharedDataForSession: User %u shares %llu bytes, too many for the update of session %u",
        session.peerUser(), static_cast<unsigned long long>(_sharedData.bytesOfUser(session.peerUser())),
        session.sessionID());
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

uint64_t ReportingdAgent::addSessionHealthInfo(const ReportingdSession& session, HealthReport& healthReport) {
  const std::optional<Dictionary>& info = session.sessionInfo();
  const Value* type = info ? info->find(kKYTReportingSessionInfoClientType) : nullptr;
  const uint64_t size = session.batchedEventsSize();
  healthReport.addSession(type != nullptr ? type->intValue() : 0, size);
  return size;
}

// The session that asks is added once more in the end. Asked for a listed session, the report counts it
// twice, deliberately: the servers' figures have always been read that way.
void ReportingdAgent::addAgentHealthInfoForSession(ReportingdSession& session, Dictionary& payload) {
  Platform& platform = configuration_.platform;
  MonitorLock lock(monitor_);
  HealthReport report;
  uint64_t batchedEvents = 0;
  for (const auto& listed : _sessionList) batchedEvents += addSessionHealthInfo(*listed, report);
  batchedEvents += addSessionHealthInfo(session, report);
  report.write(payload);
  if (!cachedStorebagsSize_) cachedStorebagsSize_ = objectSizeEstimate(_cachedStorebags, platform.memory);
  payload.set("StorebagsCount", static_cast<uint64_t>(_cachedStorebags.size()));
  payload.set("StorebagsSize", *cachedStorebagsSize_);
  payload.set("CalculatedMemoryUsage", batchedEvents + *cachedStorebagsSize_);
  payload.set("ProcessMemoryUsage", platform.memory.internalMemory());
}

}  // namespace kyt
