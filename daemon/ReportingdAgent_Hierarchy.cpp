// Which sessions belong together, who is whose parent, and who aggregates for whom.
#include <string>
#include <string_view>
#include <utility>

#include "daemon/ReportingdAgent.h"
#include "platform/Platform.h"
#include "platform/base/Counters.h"
#include "platform/base/Limits.h"
#include "platform/base/UserBudget.h"
#include "platform/queues/Log.h"
#include "session/ReportingdSession.h"

namespace kyt {

namespace {

// Forty levels: each session that joins a hierarchy with a gap writes a line for every session beneath it.
constexpr size_t kMostShownOfAPath = 1024;  // bytes

std::string shownPath(std::string_view path) {
  std::string shown(path.substr(0, kMostShownOfAPath));
  if (path.size() > kMostShownOfAPath) shown += " (cut)";
  return shown;
}

}  // namespace

void ReportingdAgent::removeFromGroups(ReportingdSession& session) {
  const auto registration = registrations_.find(&session);
  if (registration == registrations_.end()) return;
  _correlatedSessions.at(registration->second.token).remove(registration->second.place);
  registrations_.erase(registration);
}

// Arrays of tokens stay for the life of the process, so the tokens that one user's sessions bring are
// limited.
bool ReportingdAgent::addGroup(const String& token, ReportingdSession& session) {
  constexpr uint64_t kGroupBytes = 512;
  Platform& platform = configuration_.platform;
  const std::shared_ptr<UserAccount> account = platform.budget.account(session.peerUser());
  if (!account->take(Share::hierarchyTokens, 1)) {
    if (platform.counters.addAndMayLog(Reason::hierarchyTokenRefused, platform.clock.monotonic()))
      platform.log.error(
          "updateCorrelatedSessions: User %u has %llu hierarchy tokens, the most allowed: session %u counts as standalone",
          session.peerUser(), static_cast<unsigned long long>(account->holds(Share::hierarchyTokens)),
          session.sessionID());
    return false;
  }
  if (!account->take(Share::bytes, kGroupBytes + token.size(), kLeftForMessages)) {
    account->giveBack(Share::hierarchyTokens, 1);
    if (platform.counters.addAndMayLog(Reason::userBytesExceeded, platform.clock.monotonic()))
      platform.log.error(
          "updateCorrelatedSessions: User %u holds too many bytes for another hierarchy token: session %u counts as standalone",
          session.peerUser(), session.sessionID());
    return false;
  }
  _correlatedSessions[token.str()];
  tokenCount_.store(_correlatedSessions.size(), std::memory_order_relaxed);
  return true;
}

const HierarchyGroup* ReportingdAgent::group(const std::optional<String>& token) const {
  if (!token) return nullptr;
  const auto found = _correlatedSessions.find(token->view());
  return found == _correlatedSessions.end() ? nullptr : &found->second;
}

bool ReportingdAgent::isIn(const HierarchyGroup& group, const String& token,
                           const ReportingdSession& session) const {
  const auto registration = registrations_.find(&session);
  return registration != registrations_.end() && token == std::string_view(registration->second.token) &&
         group.contains(registration->second.place);
}

void ReportingdAgent::updateCorrelatedSessions(ReportingdSession& session) {
  Log& log = configuration_.platform.log;
  const std::optional<String> token = session.hierarchyToken();
  if (!token) {
    log.normal(
        "updateCorrelatedSessions: Session %u has no correlated sessions as it is a standalone session",
        session.sessionID());
    // A standalone session must not wait for somebody's download. One that drops its token stays registered where
    // it was, with the level it has now.
    if (!session.wasInHierarchy()) return;
    MonitorLock lock(monitor_);
    const auto registration = registrations_.find(&session);
    if (registration != registrations_.end())
      _correlatedSessions.at(registration->second.token).relevel(registration->second.place);
    return;
  }
  MonitorLock lock(monitor_);
  removeFromGroups(session);
  if (group(token) == nullptr && !addGroup(*token, session)) {
    session.becomeStandalone();
    return;
  }
  log.debug(
      "updateCorrelatedSessions: Adding session %u to list for hierarchyToken %s with hierarchyLevel %d",
      session.sessionID(), token->c_str(), static_cast<int>(session.hierarchyLevel()));
  const uint64_t place = _correlatedSessions.at(token->str()).append(session.shared());
  registrations_[&session] = Registration{token->str(), place};
}

std::optional<AncestorIdentifiers> ReportingdAgent::parentSessionIDStringForSession(
    ReportingdSession& session) {
  Log& log = configuration_.platform.log;
  MonitorLock lock(monitor_);
  const std::optional<String> token = session.hierarchyToken();
  const uint32_t level = session.hierarchyLevel();
  if (level == 0 || !token) return std::nullopt;
  log.debug("parentSessionIDStringForSession: Checking hierarchyToken '%s' for session %u", token->c_str(),
            session.sessionID());
  const HierarchyGroup* sessions = group(token);
  if (sessions == nullptr || sessions->empty()) {
    log.error("parentSessionIDStringForSession: ERROR: No sessions found for hierarchyToken %s",
              log.shownIdentifier(*token).c_str());
    return std::nullopt;
  }
  if (!isIn(*sessions, *token, session)) {
    log.normal("parentSessionIDStringForSession: Session %u not found for hierarchyToken %s",
               session.sessionID(), log.shownIdentifier(*token).c_str());
    return std::nullopt;
  }
  HierarchyGroup::Ancestors ancestors = sessions->ancestorsOf(level);
  if (!ancestors.complete) {
    const std::string found = ancestors.identifiers ? shownPath(ancestors.identifiers->view()) : "(null)";
    log.normal(
        "parentSessionIDStringForSession: Found a gap in hierarchy (one of parents missing): incomplete parentSessionID is '%s'",
        found.c_str());
  }
  return std::move(ancestors.identifiers);
}

std::shared_ptr<ReportingdSession> ReportingdAgent::parentSessionForChild(ReportingdSession& session) {
  Log& log = configuration_.platform.log;
  MonitorLock lock(monitor_);
  const std::optional<String> token = session.hierarchyToken();
  const uint32_t level = session.hierarchyLevel();
  if (level == 0 || !token) return nullptr;
  log.debug("parentSessionForChild: Checking hierarchyToken '%s' for session %u", token->c_str(),
            session.sessionID());
  const HierarchyGroup* sessions = group(token);
  if (sessions == nullptr || sessions->empty()) {
    log.error("parentSessionForChild: ERROR: No sessions found for hierarchyToken %s",
              log.shownIdentifier(*token).c_str());
    return nullptr;
  }
  if (!isIn(*sessions, *token, session)) {
    log.error("parentSessionForChild: ERROR: Session %u not found for hierarchyToken %s", session.sessionID(),
              log.shownIdentifier(*token).c_str());
    return nullptr;
  }
  std::shared_ptr<ReportingdSession> parent = sessions->getFirstSessionWithHierarchy(level - 1);
  if (parent == nullptr)
    log.normal("parentSessionForChild: Unable to find session with hierarchy of %d for hierarchyToken '%s'",
               static_cast<int>(level - 1), log.shownIdentifier(*token).c_str());
  return parent;
}

// Root first: the root-most aggregator wins over nearer ones.
std::shared_ptr<ReportingdSession> ReportingdAgent::getAncestorWithAggregatorForSession(
    ReportingdSession& session) {
  MonitorLock lock(monitor_);
  const HierarchyGroup* sessions = group(session.hierarchyToken());
  if (sessions == nullptr || session.hierarchyLevel() < 1) return nullptr;
  return sessions->firstAggregatorBelow(session.hierarchyLevel());
}

void ReportingdAgent::aggregationMayHaveChanged(ReportingdSession& session) {
  MonitorLock lock(monitor_);
  const auto registration = registrations_.find(&session);
  if (registration != registrations_.end())
    _correlatedSessions.at(registration->second.token).aggregationMayHaveChanged(registration->second.place);
}

void ReportingdAgent::updateDownstreamSessions(ReportingdSession& session) {
  // A standalone session must not wait for somebody's download.
  const std::optional<String> token = session.hierarchyToken();
  if (!token) return;
  MonitorLock lock(monitor_);
  session.updateCombinedSessionID();
  session.syncReportingStates();
  bool upstreamAggregator = false;
  if (session.hierarchyLevel() >= 1 && getAncestorWithAggregatorForSession(session) != nullptr) {
    session.shutdownSessionAggregation();
    upstreamAggregator = true;
  }
  const HierarchyGroup* sessions = group(token);
  if (sessions == nullptr) return;
  for (const auto& [place, member] : *sessions) {
    ReportingdSession& deeper = *member.session;
    if (deeper.hierarchyLevel() <= session.hierarchyLevel()) continue;
    configuration_.platform.log.debug(
        "updateDownstreamSessions: Updating combined session ID and syncing reporting states for session %u",
        deeper.sessionID());
    deeper.updateCombinedSessionID();
    deeper.syncReportingStates();
    // Beneath an aggregating session only the top-most aggregator stays active.
    if ((upstreamAggregator || session.hasAggregator()) && deeper.hasAggregator())
      deeper.shutdownSessionAggregation();
  }
}

}  // namespace kyt
