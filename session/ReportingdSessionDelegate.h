// All that a session knows of the agent. The agent is also the lock object for shared-data and hierarchy
// calls: the operations that say so are called while holding `monitor()`.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "backend/SessionIDPath.h"
#include "platform/objects/Value.h"
#include "platform/queues/Monitor.h"

namespace kyt {

class ReportingdSession;

class ReportingdSessionDelegate {
 public:
  virtual ~ReportingdSessionDelegate() = default;
  [[nodiscard]] virtual std::string description() const = 0;
  [[nodiscard]] virtual Monitor& monitor() = 0;

  // The section for the session's client type, from the cache or freshly fetched (blocks), or none.
  [[nodiscard]] virtual std::optional<Dictionary> storebagForSession(ReportingdSession& session) = 0;
  [[nodiscard]] virtual std::optional<String> storebagVersionForSession(ReportingdSession& session) = 0;
  [[nodiscard]] virtual std::optional<AncestorIdentifiers> parentSessionIDStringForSession(
      ReportingdSession& session) = 0;
  virtual void updateCorrelatedSessions(ReportingdSession& session) = 0;
  [[nodiscard]] virtual std::shared_ptr<ReportingdSession> getAncestorWithAggregatorForSession(
      ReportingdSession& session) = 0;
  // A session that is or was in a hierarchy aggregates now, or no longer does.
  virtual void aggregationMayHaveChanged(ReportingdSession& session) = 0;
  virtual void updateDownstreamSessions(ReportingdSession& session) = 0;
  [[nodiscard]] virtual std::shared_ptr<ReportingdSession> parentSessionForChild(
      ReportingdSession& session) = 0;
  virtual void updateSharedDataForSession(ReportingdSession& session, const Dictionary& sharedData) = 0;
  virtual void removeObjectFromSharedDataForSession(ReportingdSession& session, const String& key) = 0;
  [[nodiscard]] virtual std::optional<Dictionary> sharedDataForSession(ReportingdSession& session) = 0;
  // The session's client type, or what its back ends hold in batches, may be another than at the last health report.
  // Told after the change, once until the report has asked (figuresAreRead()). Any thread; waits for nobody.
  virtual void sessionFiguresMayHaveChanged(ReportingdSession& session) = 0;
  // Called while holding monitor().
  virtual void addAgentHealthInfoForSession(ReportingdSession& session, Dictionary& payload) = 0;
};

}  // namespace kyt
