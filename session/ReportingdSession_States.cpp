// What a session does for its hierarchy: reporting states, the combined session ID, aggregation, shared data.
#include <utility>

#include "platform/Platform.h"
#include "platform/objects/Keys.h"
#include "platform/queues/Log.h"
#include "session/ReportingdSession.h"

namespace kyt {

// Under the monitor, because other sessions of the hierarchy read and write the same states and thresholds. A
// session that never was in one need not wait for the monitor, which somebody's download may hold.
void ReportingdSession::updateReportingStates() {
  std::optional<MonitorLock> lock;
  if (wasInHierarchy_) lock.emplace(_sessionDelegate.monitor());
  for (const auto& [key, backend] : _backends) backend->updateState();
}

std::optional<Array> ReportingdSession::fetchReportingStates() const {
  if (!hasBackends()) return std::nullopt;
  Array states;
  for (const auto& [key, backend] : _backends) {
    const int32_t state = backend->state();
    if (state == kBackendStateEnabled || state == kBackendStateHeld) states.append(key);
  }
  return states;
}

uint32_t ReportingdSession::hierarchyLevel() const {
  if (!_hierarchyDictionary) return 0;
  return static_cast<uint32_t>(_hierarchyDictionary->integer(kKYTReportingHierarchyTokenLevel));
}

std::optional<String> ReportingdSession::hierarchyToken() const {
  const Value* token =
      _hierarchyDictionary ? _hierarchyDictionary->find(kKYTReportingHierarchyTokenTokenID) : nullptr;
  if (token == nullptr || token->isNull()) return std::nullopt;
  if (const String* text = token->string()) return *text;
  return String(kyt::description(*token));
}

// The agent knows which members of a hierarchy aggregate, so that no message looks for them.
void ReportingdSession::setHasAggregator(bool value) {
  const bool changed = _hasAggregator.exchange(value, std::memory_order_relaxed) != value;
  if (changed && wasInHierarchy_) _sessionDelegate.aggregationMayHaveChanged(*this);
}

void ReportingdSession::becomeStandalone() {
  _hierarchyDictionary.reset();
}

void ReportingdSession::syncReportingStates() {
  const std::shared_ptr<ReportingdSession> parent = _sessionDelegate.parentSessionForChild(*this);
  for (const auto& [key, backend] : _backends) {
    if (parent == nullptr) {
      if (hierarchyLevel() != 0)
        log().normal(
            "syncReportingStates: child session %u (backend %s) with hierarchy %d is missing its parent",
            _sessionID, backend->name().c_str(), static_cast<int>(hierarchyLevel()));
      continue;
    }
    if (backend->state() == kBackendStateHeld) continue;
    const KYTReportingBackend* parentBackend = parent->backendForKey(key);
    if (parentBackend == nullptr) {
      backend->setState(kBackendStateDisabled, StateRule::parent);
      continue;
    }
    backend->setState(parentBackend->state(), StateRule::parent);
    backend->setSamplingThreshold(parentBackend->samplingThreshold());
    // The prefix is the same for every kind of back end, deliberately: log readers look for it.
    log().debug("HTTPSPostBackend(syncReportingStates): %s: state and sampling rate updated to %d, %.02f%%",
                backend->name().c_str(), backend->state(),
                static_cast<float>(backend->samplingThreshold().doubleValue()));
  }
}

void ReportingdSession::updateCombinedSessionID() {
  std::optional<AncestorIdentifiers> parentID = _sessionDelegate.parentSessionIDStringForSession(*this);
  if (!parentID) return;
  const SessionIDPath combined(std::move(*parentID), _sessionIDString);
  // Joined for its line alone.
  if (log().debugEnabled())
    log().debug("updateCombinedSessionID: Updating combined session ID '%s' for session %u backends",
                combined.text().c_str(), _sessionID);
  for (const auto& [key, backend] : _backends) backend->setCorrelatedSessionID(combined);
  figuresMayHaveChanged();  // the records in batches have the identifier
}

uint64_t ReportingdSession::batchedEventsSize() const {
  uint64_t size = 0;
  for (const auto& [key, backend] : _backends) size += backend->batchedEventsSize();
  return size;
}

void ReportingdSession::aggregateMessage(const std::optional<Dictionary>& sessionInfo, double timestamp,
                                         uint16_t category, uint16_t type, const Dictionary* payload) {
  // Made only when somebody gets it: most sessions belong to no hierarchy and aggregate nothing.
  const auto send = [&](ReportingdSession& session) {
    std::optional<Dictionary> info = sessionInfo;
    if (info && _userInfo) info->merge(*_userInfo);
    session.sendToAggregator(info, timestamp, category, type,
                             payload != nullptr ? std::optional<Dictionary>(*payload) : std::nullopt);
  };
  // A session without a token has no ancestors, so it need not wait for the monitor to learn that.
  if (_hierarchyDictionary) {
    // Held until the message is queued, so that the ancestor cannot be torn down in between.
    MonitorLock lock(_sessionDelegate.monitor());
    if (const std::shared_ptr<ReportingdSession> ancestor =
            _sessionDelegate.getAncestorWithAggregatorForSession(*this)) {
      send(*ancestor);
      return;
    }
  }
  if (hasAggregator()) send(*this);
}

void ReportingdSession::sendToAggregator(const std::optional<Dictionary>& sessionInfo, double timestamp,
                                         uint16_t category, uint16_t type,
                                         const std::optional<Dictionary>& payload) {
  if (_connection == nullptr) return;
  const std::optional<Error> error =
      _connection->remoteObjectProxy().sendMessageToClient(sessionInfo, timestamp, category, type, payload);
  if (error)
    log().error("sendMessageWithDictionary: Failed to get remote object proxy: %s",
                error->localizedDescription.c_str());
}

// The lock makes the test and the clearing one step: an ancestor's thread and the session's own end may both
// be here.
void ReportingdSession::shutdownSessionAggregation() {
  MonitorLock lock(_sessionDelegate.monitor());
  log().debug("shutdownSessionAggregation: Disable aggregation module for session %u", _sessionID);
  if (!hasAggregator()) return;
  // All zero, without objects: how the client learns that aggregation has ended.
  sendToAggregator(std::nullopt, 0, 0, 0, std::nullopt);
  setHasAggregator(false);
}

void ReportingdSession::updateSharedDataWithDictionary(Dictionary sharedData) {
  MonitorLock lock(_sessionDelegate.monitor());
  _sessionDelegate.updateSharedDataForSession(*this, sharedData);
}

void ReportingdSession::updateSharedDataForKey(String key, Value value) {
  MonitorLock lock(_sessionDelegate.monitor());
  if (value.isNull())
    _sessionDelegate.removeObjectFromSharedDataForSession(*this, key);
  else
    _sessionDelegate.updateSharedDataForSession(*this, Dictionary{{std::move(key), std::move(value)}});
}

}  // namespace kyt
