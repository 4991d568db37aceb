// Hierarchies of sessions: parents, combined identifiers, aggregators.
#include <algorithm>
#include <chrono>
#include <random>

#include "tests/daemon/AgentFixture.h"

namespace kyt {
namespace {

class AgentHierarchy : public AgentFixture {
 protected:
  std::optional<std::string> parentID(const Client& client) {
    const std::optional<AncestorIdentifiers> id = agent_.parentSessionIDStringForSession(*client.session);
    return id ? std::optional<std::string>(id->view()) : std::nullopt;
  }
  static std::string id(const Client& client) { return client.session->sessionIDString().str(); }
};

TEST_F(AgentHierarchy, ASessionWithoutATokenIsStandalone) {
  const Client client = clientWith(sessionInfo(7, 5));
  EXPECT_TRUE(
      logged(LogLevel::normal,
             "updateCorrelatedSessions: Session 5 has no correlated sessions as it is a standalone session"));
  EXPECT_EQ(agent_.hierarchyTokenCount(), 0U);
  EXPECT_FALSE(parentID(client));
  EXPECT_EQ(agent_.parentSessionForChild(*client.session), nullptr);
  EXPECT_EQ(agent_.getAncestorWithAggregatorForSession(*client.session), nullptr);
}

TEST_F(AgentHierarchy, JoinsTheAncestorsIdentifiersRootFirst) {
  const Client a = clientWith(sessionInfoAt(0)), b = clientWith(sessionInfoAt(1)),
               c = clientWith(sessionInfoAt(2));
  const Client d = clientWith(sessionInfoAt(3, "T", 9));
  EXPECT_EQ(parentID(d), id(a) + "." + id(b) + "." + id(c));
  EXPECT_TRUE(logged(
      LogLevel::debug,
      "updateCorrelatedSessions: Adding session 9 to list for hierarchyToken T with hierarchyLevel 3"));
  EXPECT_TRUE(
      logged(LogLevel::debug, "parentSessionIDStringForSession: Checking hierarchyToken 'T' for session 9"));
  EXPECT_EQ(agent_.parentSessionForChild(*d.session), c.session);
}

TEST_F(AgentHierarchy, AGapGivesThePartBelowIt) {
  const Client a = clientWith(sessionInfoAt(0)), c = clientWith(sessionInfoAt(2)),
               d = clientWith(sessionInfoAt(3));
  EXPECT_EQ(parentID(d), id(c));
  EXPECT_TRUE(logged(
      LogLevel::normal,
      "parentSessionIDStringForSession: Found a gap in hierarchy (one of parents missing): incomplete parentSessionID is '" +
          id(c) + "'"));
}

TEST_F(AgentHierarchy, TheGapLineShowsTheBeginningOfALongPath) {
  std::vector<Client> clients;
  for (int level = 1; level <= 60; ++level) clients.push_back(clientWith(sessionInfoAt(level)));
  const std::string path = *parentID(clients.back());
  ASSERT_GT(path.size(), 1024U);
  EXPECT_TRUE(logged(LogLevel::normal, "incomplete parentSessionID is '" + path.substr(0, 1024) + " (cut)'"));
}

TEST_F(AgentHierarchy, ALevelTwoSessionWithoutARootGetsItsParentsIDAndTheGapLine) {
  const Client b = clientWith(sessionInfoAt(1)), c = clientWith(sessionInfoAt(2));
  EXPECT_EQ(parentID(c), id(b));
  EXPECT_TRUE(logged(LogLevel::normal, "incomplete parentSessionID is '" + id(b) + "'"));
}

TEST_F(AgentHierarchy, AGapRightAboveGivesNothing) {
  const Client a = clientWith(sessionInfoAt(0)), c = clientWith(sessionInfoAt(2));
  EXPECT_FALSE(parentID(c));
  EXPECT_TRUE(logged(LogLevel::normal, "incomplete parentSessionID is '(null)'"));
  EXPECT_EQ(agent_.parentSessionForChild(*c.session), nullptr);
  EXPECT_TRUE(
      logged(LogLevel::normal,
             "parentSessionForChild: Unable to find session with hierarchy of 1 for hierarchyToken 'T'"));
}

TEST_F(AgentHierarchy, ATopSessionHasNoParentAndNoLine) {
  const Client a = clientWith(sessionInfoAt(0));
  test_.sink.clear();
  EXPECT_FALSE(parentID(a));
  EXPECT_TRUE(test_.sink.lines().empty());
}

TEST_F(AgentHierarchy, TheHighestLevelCostsNothing) {
  const Client top = clientWith(sessionInfoAt(0)), deep = clientWith(sessionInfoAt(-1));
  EXPECT_EQ(deep.session->hierarchyLevel(), 4294967295U);
  EXPECT_FALSE(parentID(deep));
  EXPECT_EQ(agent_.parentSessionForChild(*deep.session), nullptr);
  top.session->setHasAggregator(true);
  EXPECT_EQ(agent_.getAncestorWithAggregatorForSession(*deep.session), top.session);
}

TEST_F(AgentHierarchy, AFirstSessionOfALevelIsTheOneFoundUntilItRegistersAgain) {
  Client a = clientWith(sessionInfoAt(0)), b = clientWith(sessionInfoAt(0));
  const Client child = clientWith(sessionInfoAt(1));
  EXPECT_EQ(agent_.parentSessionForChild(*child.session), a.session);
  identify(a, sessionInfoAt(0));
  EXPECT_EQ(agent_.parentSessionForChild(*child.session), b.session) << "a moved to the end";
}

TEST_F(AgentHierarchy, RegisteringTwiceListsASessionOnce) {
  Client a = clientWith(sessionInfoAt(0));
  identify(a, sessionInfoAt(0));
  a.connection->invalidateNow();
  const Client child = clientWith(sessionInfoAt(1));
  EXPECT_EQ(agent_.parentSessionForChild(*child.session), nullptr);
}

TEST_F(AgentHierarchy, ANewTokenTakesTheSessionOutOfTheOldOne) {
  Client a = clientWith(sessionInfoAt(0));
  const Client child = clientWith(sessionInfoAt(1)), other = clientWith(sessionInfoAt(1, "U"));
  identify(a, sessionInfoAt(0, "U"));
  EXPECT_EQ(agent_.parentSessionForChild(*child.session), nullptr);
  EXPECT_EQ(agent_.parentSessionForChild(*other.session), a.session);
  EXPECT_EQ(agent_.hierarchyTokenCount(), 2U);
}

TEST_F(AgentHierarchy, ASessionThatDropsItsTokenStaysRegisteredAsATopSession) {
  Client a = clientWith(sessionInfoAt(3));
  const Client child = clientWith(sessionInfoAt(1));
  identify(a, sessionInfo());
  EXPECT_EQ(agent_.parentSessionForChild(*child.session), a.session);
  a.connection->invalidateNow();
  EXPECT_EQ(agent_.parentSessionForChild(*child.session), nullptr) << "a session that ended is found nowhere";
}

TEST_F(AgentHierarchy, ASessionThatWasInvalidatedIsNotFound) {
  const Client a = clientWith(sessionInfoAt(0)), b = clientWith(sessionInfoAt(1, "T", 8));
  agent_.invalidateReportingSession(b.session);
  EXPECT_FALSE(parentID(b));
  EXPECT_TRUE(
      logged(LogLevel::normal, "parentSessionIDStringForSession: Session 8 not found for hierarchyToken T"));
  EXPECT_EQ(agent_.parentSessionForChild(*b.session), nullptr);
  EXPECT_TRUE(
      logged(LogLevel::error, "parentSessionForChild: ERROR: Session 8 not found for hierarchyToken T"));
  agent_.invalidateReportingSession(a.session);
  EXPECT_FALSE(parentID(b));
  EXPECT_TRUE(logged(LogLevel::error,
                     "parentSessionIDStringForSession: ERROR: No sessions found for hierarchyToken T"));
  EXPECT_EQ(agent_.parentSessionForChild(*b.session), nullptr);
  EXPECT_TRUE(
      logged(LogLevel::error, "parentSessionForChild: ERROR: No sessions found for hierarchyToken T"));
}

TEST_F(AgentHierarchy, TheRootMostAggregatorWins) {
  const Client a = clientWith(sessionInfoAt(0), true), b = clientWith(sessionInfoAt(1), true);
  const Client c = clientWith(sessionInfoAt(2));
  EXPECT_EQ(agent_.getAncestorWithAggregatorForSession(*c.session), a.session);
  EXPECT_EQ(agent_.getAncestorWithAggregatorForSession(*a.session), nullptr);
  a.session->setHasAggregator(false);
  EXPECT_EQ(agent_.getAncestorWithAggregatorForSession(*c.session), b.session);
}

TEST_F(AgentHierarchy, OnlyTheFirstSessionOfALevelCountsAsAggregator) {
  const Client first = clientWith(sessionInfoAt(0)), second = clientWith(sessionInfoAt(0), true);
  const Client child = clientWith(sessionInfoAt(1));
  EXPECT_EQ(agent_.getAncestorWithAggregatorForSession(*child.session), nullptr);
}

// Compared with a walk over all sessions.
TEST_F(AgentHierarchy, TheAggregatorIsTheRightOneAfterAnyChanges) {
  constexpr int kClients = 8, kLevels = 4, kChanges = 3000;
  std::mt19937 random(7);
  const auto below = [&](int end) { return static_cast<int>(random() % static_cast<unsigned>(end)); };
  std::vector<Client> clients;
  std::vector<size_t> order;  // of registration
  for (int i = 0; i < kClients; ++i) {
    clients.push_back(clientWith(sessionInfoAt(below(kLevels))));
    order.push_back(clients.size() - 1);
  }
  const auto expected = [&](const ReportingdSession& session) -> std::shared_ptr<ReportingdSession> {
    for (uint32_t level = 0; level < session.hierarchyLevel(); ++level)
      for (const size_t one : order)
        if (clients[one].session->hierarchyLevel() == level) {
          if (clients[one].session->hasAggregator()) return clients[one].session;
          break;
        }
    return nullptr;
  };
  for (int change = 0; change < kChanges; ++change) {
    const auto chosen = static_cast<size_t>(below(kClients));
    Client& client = clients[chosen];
    switch (below(3)) {
      case 0:
        client.session->setHasAggregator(below(3) == 0);
        break;
      case 1:  // no token: stays where it is registered
        client.session->setSessionInfo(Dictionary{{kKYTReportingSessionInfoSessionID, 5}}, std::nullopt,
                                       nullptr, below(3) == 0);
        break;
      default:
        client.session->setSessionInfo(sessionInfoAt(below(kLevels)), std::nullopt, nullptr, below(3) == 0);
        std::erase(order, chosen);
        order.push_back(chosen);
    }
    for (const Client& one : clients) {
      if (!one.session->hierarchyToken()) continue;
      ASSERT_EQ(agent_.getAncestorWithAggregatorForSession(*one.session), expected(*one.session)) << change;
    }
  }
}

// It is asked for each message of each session of a hierarchy.
TEST_F(AgentHierarchy, TheAggregatorIsFoundAtTheSameCostHoweverDeepAHierarchyIs) {
  const auto costAt = [&](int levels, const char* token) {
    std::vector<Client> clients;
    for (int level = 0; level < levels; ++level) clients.push_back(clientWith(sessionInfoAt(level, token)));
    auto least = Duration::max();
    for (int round = 0; round < 20; ++round) {
      const auto begin = std::chrono::steady_clock::now();
      for (int call = 0; call < 200; ++call)
        EXPECT_EQ(agent_.getAncestorWithAggregatorForSession(*clients.back().session), nullptr);
      least = std::min<Duration>(least, std::chrono::steady_clock::now() - begin);
    }
    return least.count();
  };
  const auto shallow = costAt(2, "shallow");
  EXPECT_LT(costAt(200, "deep"), 4 * shallow);
  EXPECT_LT(costAt(3000, "deepest"), 8 * shallow) << "whose sessions are no longer in the processor's caches";
}

TEST_F(AgentHierarchy, AnUpdateShutsDownTheAggregationBeneathAnAggregator) {
  const Client a = clientWith(sessionInfoAt(0), true), b = clientWith(sessionInfoAt(1, "T", 6), true);
  agent_.updateDownstreamSessions(*a.session);
  EXPECT_TRUE(a.session->hasAggregator());
  EXPECT_FALSE(b.session->hasAggregator());
  EXPECT_EQ(b.connection->messagesToClient().size(), 1U);
  EXPECT_TRUE(logged(
      LogLevel::debug,
      "updateDownstreamSessions: Updating combined session ID and syncing reporting states for session 6"));
}

TEST_F(AgentHierarchy, AnUpdateBeneathAnAggregatorShutsDownTheSessionsOwnAggregation) {
  const Client a = clientWith(sessionInfoAt(0), true), b = clientWith(sessionInfoAt(1), true);
  const Client c = clientWith(sessionInfoAt(2), true);
  agent_.updateDownstreamSessions(*b.session);
  EXPECT_TRUE(a.session->hasAggregator());
  EXPECT_FALSE(b.session->hasAggregator());
  EXPECT_FALSE(c.session->hasAggregator()) << "b no longer aggregates, but a does";
}

// In the order in which they registered, not by level: the session of level 2, registered first, is brought in
// step with a parent that is itself brought in step only after it.
TEST_F(AgentHierarchy, AnUpdateVisitsSessionsInTheOrderOfTheirRegistration) {
  Client c = clientWith(sessionInfoAt(2, "T", 7)), b = clientWith(sessionInfoAt(1, "T", 6));
  configure(c);
  const auto backendOfC = factory_.latest("httppost");
  configure(b);
  const auto backendOfB = factory_.latest("httppost");
  factory_.prepare = [](RecordingBackend& made) { made.stateAfterUpdate = kBackendStateDisabled; };
  Client a = clientWith(sessionInfoAt(0));
  test_.sink.clear();
  configure(a);
  EXPECT_EQ(backendOfB->state(), kBackendStateDisabled);
  EXPECT_EQ(backendOfC->state(), kBackendStateEnabled) << "its parent's state of that moment";
  const std::string line =
      "updateDownstreamSessions: Updating combined session ID and syncing reporting states for session ";
  std::vector<std::string> visited;
  for (const auto& logged : test_.sink.lines())
    if (logged.line.starts_with(line)) visited.push_back(logged.line.substr(line.size()));
  EXPECT_EQ(visited, (std::vector<std::string>{"7", "6"}));
}

TEST_F(AgentHierarchy, AnUpdateLeavesOthersOfTheSameLevelAlone) {
  const Client a = clientWith(sessionInfoAt(1, "T", 5), true),
               sibling = clientWith(sessionInfoAt(1, "T", 6), true);
  agent_.updateDownstreamSessions(*a.session);
  EXPECT_TRUE(sibling.session->hasAggregator());
  EXPECT_FALSE(logged(
      LogLevel::debug,
      "updateDownstreamSessions: Updating combined session ID and syncing reporting states for session 6"));
}

TEST_F(AgentHierarchy, AnUpdateReachesTheHighestLevelWhichIsNoNegativeNumber) {
  const Client a = clientWith(sessionInfoAt(0), true), deep = clientWith(sessionInfoAt(-1, "T", 6), true);
  agent_.updateDownstreamSessions(*a.session);
  EXPECT_FALSE(deep.session->hasAggregator());
}

TEST_F(AgentHierarchy, AnUpdateOfAStandaloneSessionTouchesNobody) {
  const Client alone = clientWith(sessionInfo(7, 5), true), other = clientWith(sessionInfoAt(1), true);
  test_.sink.clear();
  agent_.updateDownstreamSessions(*alone.session);
  EXPECT_TRUE(other.session->hasAggregator());
  EXPECT_TRUE(alone.session->hasAggregator());
  EXPECT_TRUE(test_.sink.lines().empty());
}

TEST_F(AgentHierarchy, AnUpdateWithoutAnyAggregatorLeavesDeeperOnesAlone) {
  const Client a = clientWith(sessionInfoAt(0)), b = clientWith(sessionInfoAt(1), true);
  agent_.updateDownstreamSessions(*a.session);
  EXPECT_TRUE(b.session->hasAggregator());
}

TEST_F(AgentHierarchy, ConfigurationBringsStatesAndCombinedIDsDown) {
  Client child = clientWith(sessionInfoAt(1));
  configure(child);
  const auto childBackend = factory_.latest("httppost");
  factory_.prepare = [](RecordingBackend& made) { made.stateAfterUpdate = kBackendStateDisabled; };
  Client parent = clientWith(sessionInfoAt(0));
  EXPECT_EQ(configure(parent), Array{});
  EXPECT_EQ(childBackend->state(), kBackendStateDisabled);
  EXPECT_EQ(childBackend->combinedSessionIDString(), String(id(parent) + "." + id(child)));
}

TEST_F(AgentHierarchy, ATokenIsShownByItsBeginningAloneUnlessDebugLinesShowItAnyway) {
  const std::string token = "0123456789abcdef0123456789abcdef";
  Client first = clientWith(sessionInfoAt(2, token.c_str(), 7));
  configure(first);
  EXPECT_TRUE(logged(LogLevel::normal, "hierarchy of 1 for hierarchyToken '" + token + "'"));
  test_.log.setLevel(LogLevel::normal);
  test_.sink.clear();
  Client child = clientWith(sessionInfoAt(2, token.c_str(), 8));
  configure(child);
  EXPECT_TRUE(logged(LogLevel::normal,
                     "parentSessionForChild: Unable to find session with hierarchy of 1 for hierarchyToken "
                     "'01234567...'"));
  EXPECT_FALSE(logged(LogLevel::normal, token));
  EXPECT_FALSE(logged(LogLevel::error, token));
}

TEST_F(AgentHierarchy, TokensOfOneUserAreLimited) {
  test_.budget.shares()[Share::hierarchyTokens] = 2;
  clientWith(sessionInfoAt(0, "A"));
  clientWith(sessionInfoAt(0, "B"));
  const Client refused = clientWith(sessionInfoAt(1, "C", 7));
  EXPECT_FALSE(refused.session->hierarchyToken());
  EXPECT_EQ(refused.session->hierarchyLevel(), 0U);
  EXPECT_EQ(agent_.hierarchyTokenCount(), 2U);
  EXPECT_EQ(test_.counters.value(Reason::hierarchyTokenRefused), 1U);
  EXPECT_TRUE(logged(LogLevel::error,
                     "updateCorrelatedSessions: User 1000 has 2 hierarchy tokens, the most allowed: "
                     "session 7 counts as standalone"));
  clientWith(sessionInfoAt(1, "D"));
  EXPECT_EQ(test_.sink.count(LogLevel::error, "the most allowed"), 1U) << "logged once a minute";
  EXPECT_TRUE(clientWith(sessionInfoAt(1, "B")).session->hierarchyToken())
      << "a token that exists may be joined";
  EXPECT_TRUE(clientWith(sessionInfoAt(0, "E"), false, 1001).session->hierarchyToken()) << "another user's";
}

TEST_F(AgentHierarchy, TokensOfOneUserTakeOfHisMemory) {
  test_.budget.shares()[Share::bytes] = 8000;
  const auto account = test_.budget.account(1000);
  clientWith(sessionInfoAt(0, "A"));
  const uint64_t one = account->holds(Share::bytes);
  EXPECT_GE(one, 500U);
  account->takeAnyway(Share::bytes, 6000 - one);  // three quarters are for what can be refused
  const Client refused = clientWith(sessionInfoAt(1, "B", 7));
  EXPECT_FALSE(refused.session->hierarchyToken());
  EXPECT_EQ(account->holds(Share::bytes), 6000U);
  EXPECT_EQ(account->holds(Share::hierarchyTokens), 1U) << "a refused one is not counted";
  EXPECT_EQ(test_.counters.value(Reason::userBytesExceeded), 1U);
  EXPECT_TRUE(logged(LogLevel::error,
                     "updateCorrelatedSessions: User 1000 holds too many bytes for another hierarchy token: "
                     "session 7 counts as standalone"));
}

TEST_F(AgentHierarchy, ATokenCountsOnceHoweverManySessionsJoinItAndHoweverOften) {
  test_.budget.shares()[Share::hierarchyTokens] = 2;
  Client a = clientWith(sessionInfoAt(0, "A")), child = clientWith(sessionInfoAt(1, "A"));
  identify(child, sessionInfoAt(1, "A"));
  const Client other = clientWith(sessionInfoAt(0, "B"));
  EXPECT_TRUE(other.session->hierarchyToken()) << "the second token of the two";
  EXPECT_FALSE(clientWith(sessionInfoAt(0, "C")).session->hierarchyToken());
  identify(child, sessionInfoAt(1, "A"));
  EXPECT_EQ(agent_.parentSessionForChild(*child.session), a.session) << "at the limit a token is kept";
  a.connection->invalidateNow();
  const Client next = clientWith(sessionInfoAt(0, "A"));
  EXPECT_EQ(agent_.parentSessionForChild(*child.session), next.session);
  EXPECT_EQ(test_.counters.value(Reason::hierarchyTokenRefused), 1U);
}

TEST_F(AgentHierarchy, ALevelThatComesOrGoesChangesWhatIsAboveTheOthers) {
  const Client a = clientWith(sessionInfoAt(0)), c = clientWith(sessionInfoAt(2)),
               d = clientWith(sessionInfoAt(3));
  EXPECT_EQ(parentID(d), id(c));
  Client b = clientWith(sessionInfoAt(1));
  EXPECT_EQ(parentID(d), id(a) + "." + id(b) + "." + id(c));
  const Client second = clientWith(sessionInfoAt(1));
  EXPECT_EQ(parentID(d), id(a) + "." + id(b) + "." + id(c)) << "the first of a level counts";
  b.connection->invalidateNow();
  EXPECT_EQ(parentID(d), id(a) + "." + id(second) + "." + id(c));
  Client moves = second;
  identify(moves, sessionInfo());
  EXPECT_EQ(parentID(c), std::nullopt) << "its level is 0 now";
  EXPECT_EQ(parentID(d), id(c));
}

// Each session that comes changes the identifiers of all beneath it. They are joined when somebody reads them: joined at
// once, the cost of a hierarchy was the cube of its depth, while every other session waited.
TEST_F(AgentHierarchy, IdentifiersAreJoinedWhenTheyAreRead) {
  constexpr int kLevels = 300;
  std::vector<Client> clients(kLevels);
  std::vector<std::shared_ptr<RecordingBackend>> backends(kLevels);
  const auto add = [&](int level) {
    clients[level] = clientWith(sessionInfoAt(level));
    configure(clients[level]);
    backends[level] = factory_.latest("httppost");
  };
  test_.log.setLevel(LogLevel::error);
  add(0);
  for (int level = kLevels - 1; level > 0; --level) add(level);
  for (int level = 1; level < kLevels; ++level) {
    ASSERT_FALSE(backends[level]->correlatedIDs.empty());
    for (const SessionIDPath& path : backends[level]->correlatedIDs) ASSERT_FALSE(path.isJoined()) << level;
  }
  const auto above = [&](int level) {
    return agent_.parentSessionIDStringForSession(*clients[level].session);
  };
  EXPECT_EQ(above(kLevels - 1)->text, above(1)->text) << "one text for all";
  std::string expected = id(clients[0]);
  for (int level = 1; level < kLevels; ++level) {
    expected += "." + id(clients[level]);
    ASSERT_EQ(backends[level]->combinedSessionIDString(), String(expected)) << level;
  }
  EXPECT_TRUE(backends[1]->correlatedIDs.back().isJoined()) << "once";
}

// A client may stack all its connections. What stands above each is copied from one text; joined anew level
// by level this took the square of their number for each, for minutes, while every other session waited.
TEST_F(AgentHierarchy, ThousandsOfLevelsBeneathEachOtherAreJoined) {
  constexpr int kLevels = 3000;
  std::vector<Client> clients;
  for (int level = 0; level < kLevels; ++level) clients.push_back(clientWith(sessionInfoAt(level)));
  std::string expected;
  for (int level = 1; level < kLevels; ++level) {
    expected += (level == 1 ? "" : ".") + id(clients[level - 1]);
    ASSERT_EQ(parentID(clients[level]), expected) << level;
  }
}

}  // namespace
}  // namespace kyt
