// Shared data and the health report.
#include "platform/objects/ObjectSize.h"
#include "tests/daemon/AgentFixture.h"

namespace kyt {
namespace {

class AgentSharedData : public AgentFixture {
 protected:
  std::optional<Dictionary> shared(const Client& client) {
    return agent_.sharedDataForSession(*client.session);
  }
  void update(const Client& client, Dictionary data) {
    client.session->updateSharedDataWithDictionary(std::move(data));
  }
};

TEST_F(AgentSharedData, IsSharedByTheSessionsOfOneToken) {
  const Client a = clientWith(sessionInfoAt(0)), b = clientWith(sessionInfoAt(1)),
               other = clientWith(sessionInfoAt(0, "U"));
  EXPECT_FALSE(shared(a));
  update(a, Dictionary{{"k", 1}, {"l", 2}});
  update(b, Dictionary{{"k", 3}});
  EXPECT_EQ(shared(a), (Dictionary{{"k", 3}, {"l", 2}}));
  EXPECT_EQ(shared(b), shared(a));
  EXPECT_FALSE(shared(other));
}

TEST_F(AgentSharedData, LosesAKeyThatIsRemoved) {
  const Client a = clientWith(sessionInfoAt(0));
  a.session->updateSharedDataForKey("absent", nullptr);
  EXPECT_FALSE(shared(a));
  update(a, Dictionary{{"k", 1}});
  a.session->updateSharedDataForKey("absent", nullptr);
  EXPECT_EQ(shared(a), (Dictionary{{"k", 1}}));
  a.session->updateSharedDataForKey("k", nullptr);
  EXPECT_EQ(shared(a), Dictionary());
}

TEST_F(AgentSharedData, IsNotForSessionsWithoutAToken) {
  const Client a = clientWith(sessionInfo());
  update(a, Dictionary{{"k", 1}});
  a.session->updateSharedDataForKey("k", nullptr);
  EXPECT_FALSE(shared(a));
}

TEST_F(AgentSharedData, OfASessionWithoutATokenIsCountedAndToldOnceAMinuteForEachUser) {
  const Client a = clientWith(sessionInfo(7, 3)), other = clientWith(sessionInfo(), false, 1001);
  const auto told = [this](const char* user) {
    return test_.sink.count(LogLevel::normal, std::string("of user ") + user +
                                                  " shares data and has no hierarchy token, it is left out");
  };
  update(a, Dictionary{{"k", 1}});
  update(a, Dictionary{{"k", 2}});
  EXPECT_EQ(test_.counters.value(Reason::sharedDataRefused), 2U);
  EXPECT_EQ(told("1000"), 1U);
  EXPECT_TRUE(logged(LogLevel::normal, "updateSharedDataForSession: Session 3 of user 1000 shares data"));
  a.session->updateSharedDataForKey("k", nullptr);
  EXPECT_EQ(test_.counters.value(Reason::sharedDataRefused), 2U) << "there was nothing to take away";
  update(other, Dictionary{{"k", 1}});
  EXPECT_EQ(told("1001"), 1U);
  test_.clock.advance(std::chrono::minutes(1));
  update(a, Dictionary{{"k", 3}});
  EXPECT_EQ(told("1000"), 2U);
}

TEST_F(AgentSharedData, ReachesTheBackEndsOfTheWholeHierarchy) {
  const Client a = clientWith(sessionInfoAt(0));
  Client b = clientWith(sessionInfoAt(1));
  configure(b);
  update(a, Dictionary{{"k", 1}});
  b.session->sendMessageWithDictionary(Dictionary{{"Category", 1}, {"Type", 2}}, nullptr);
  EXPECT_EQ(factory_.latest("httppost")->sent.back().message,
            (Dictionary{{"SharedData", Dictionary{{"k", 1}}}}));
}

TEST_F(AgentSharedData, OfOneUserIsLimited) {
  test_.budget.shares()[Share::sharedDataBytes] = 2000;
  ReportingdAgent agent(test_.configuration, fetcher_, class_, transaction_);
  listener_.setDelegate(agent);
  const Client a = clientWith(sessionInfoAt(0, "T", 3)),
               other = clientWith(sessionInfoAt(0, "U"), false, 1001);
  const auto data = [&](const Client& client) { return agent.sharedDataForSession(*client.session); };
  update(a, Dictionary{{"k", std::string(1000, 'x')}});
  update(a, Dictionary{{"l", std::string(1000, 'y')}, {"m", 1}});
  EXPECT_EQ(data(a)->size(), 1U) << "refused as a whole";
  EXPECT_EQ(test_.counters.value(Reason::sharedDataRefused), 1U);
  EXPECT_TRUE(logged(LogLevel::error, "updateSharedDataForSession: User 1000 shares "));
  update(a, Dictionary{{"k", std::string(1100, 'z')}});
  EXPECT_EQ(*data(a)->find("k"), Value(std::string(1100, 'z'))) << "what it replaces counts no more";
  a.session->updateSharedDataForKey("k", nullptr);
  update(a, Dictionary{{"l", std::string(1000, 'y')}});
  EXPECT_EQ(data(a)->size(), 1U);
  update(other, Dictionary{{"k", std::string(1000, 'x')}});
  EXPECT_EQ(data(other)->size(), 1U) << "another user's";
  for (const Client* client : {&a, &other}) client->connection->invalidateNow();
}

class AgentHealth : public AgentFixture {
 protected:
  Dictionary report(const Client& client) {
    Dictionary payload;
    MonitorLock lock(agent_.monitor());
    agent_.addAgentHealthInfoForSession(*client.session, payload);
    return payload;
  }
};

TEST_F(AgentHealth, CountsTheSessionThatAsksTwice) {
  const Client a = clientWith(sessionInfo(7)), b = clientWith(sessionInfo(7)),
               c = clientWith(sessionInfo(12));
  const Dictionary payload = report(a);
  EXPECT_EQ(*payload.find("SessionsCount_QH"), Value(3));
  EXPECT_EQ(*payload.find("SessionsCount_QNPA"), Value(1));
  EXPECT_EQ(*payload.find("BatchSize_QH"), Value(0));
}

TEST_F(AgentHealth, CountsTypesBelowFiveAsUnknown) {
  const Client a = clientWith(sessionInfo(2)), b = clientWith(sessionInfo(99)), c = connect();
  const Dictionary payload = report(a);
  EXPECT_EQ(*payload.find("SessionsCount_Unknown"), Value(4));
  EXPECT_FALSE(payload.contains("SessionsCount_QCX"));
}

TEST_F(AgentHealth, AddsUpWhatSessionsHoldInBatches) {
  factory_.prepare = [](RecordingBackend& made) { made.batchSize = 1000; };
  Client a = clientWith(sessionInfo(7)), b = clientWith(sessionInfo(7));
  configure(a);
  configure(b);
  const Dictionary payload = report(a);
  EXPECT_EQ(*payload.find("BatchSize_QH"), Value(3000));
  const uint64_t storebags = payload.find("StorebagsSize")->unsignedLongLongValue();
  EXPECT_GT(storebags, 0U);
  EXPECT_EQ(*payload.find("CalculatedMemoryUsage"), Value(3000 + storebags));
  EXPECT_EQ(*payload.find("StorebagsCount"), Value(1));
  EXPECT_GT(payload.find("ProcessMemoryUsage")->unsignedLongLongValue(), 0U);
}

TEST_F(AgentHealth, TellsWhatChangedSinceTheLastReport) {
  Client asks = clientWith(sessionInfo(12)), a = clientWith(sessionInfo(7));
  configure(a);
  const auto backend = factory_.latest("httppost");
  const auto batchSize = [&](const char* code) {
    const Dictionary payload = report(asks);
    const Value* size = payload.find(std::string("BatchSize_") + code);
    return size != nullptr ? size->longLongValue() : -1;
  };
  EXPECT_EQ(batchSize("QH"), 0);
  backend->batchSize = 1;
  a.session->sendMessageWithDictionary(Dictionary{{"Category", 1}, {"Type", 2}}, nullptr);
  EXPECT_EQ(batchSize("QH"), 1);
  backend->batchSize = 2;
  a.session->flushMessagesWithCompletion(nullptr);
  EXPECT_EQ(batchSize("QH"), 2);
  identify(a, sessionInfo(20));
  EXPECT_EQ(batchSize("QH"), -1);
  EXPECT_EQ(batchSize("QPW"), 2);
  identify(a, sessionInfoAt(1));  // type 7
  const Client parent = clientWith(sessionInfoAt(0));
  EXPECT_EQ(batchSize("QH"), 2);
  backend->batchSize = 3;
  agent_.updateDownstreamSessions(*parent.session);
  EXPECT_EQ(batchSize("QH"), 3) << "another combined identifier changes the records";
  backend->batchSize = 4;
  configure(a);
  EXPECT_EQ(batchSize("QH"), 0) << "new back ends";
  a.connection->invalidateNow();
  EXPECT_EQ(batchSize("QH"), 0) << "the parent alone";
}

// All sessions end at once when the daemon does, and each asks for a report: visiting all for each took seconds
// for some thousands of them.
TEST_F(AgentHealth, VisitsOnlySessionsWhoseFiguresMayHaveChanged) {
  constexpr size_t kSessions = 300;
  std::vector<Client> clients;
  for (size_t i = 0; i < kSessions; ++i) {
    clients.push_back(clientWith(sessionInfo(7)));
    configure(clients.back());
  }
  const auto questions = [&] {
    uint64_t sum = 0;
    for (const auto& backend : factory_.made()) sum += backend->sizeQuestions;
    return sum;
  };
  EXPECT_EQ(*report(clients[0]).find("SessionsCount_QH"), Value(kSessions + 1));
  const uint64_t before = questions();
  EXPECT_EQ(*report(clients[1]).find("SessionsCount_QH"), Value(kSessions + 1));
  EXPECT_LE(questions() - before, 2U);
  for (const Client& client : clients) client.connection->invalidateNow();
  EXPECT_LE(questions() - before, 4 * kSessions);
  const auto& last = factory_.made().back()->sent.back();
  EXPECT_EQ(*last.message.find("ClientData")->dictionary()->find("SessionsCount_QH"), Value(1))
      << "of itself";
}

TEST_F(AgentHealth, ReadsASumOfBatchesAsAThirtyTwoBitNumberBeforeItAdds) {
  factory_.prepare = [](RecordingBackend& made) { made.batchSize = 0x1'0000'0001; };
  Client a = clientWith(sessionInfo(7));
  configure(a);
  EXPECT_EQ(*report(a).find("BatchSize_QH"), Value(0x1'0000'0002));
}

TEST_F(AgentHealth, AnEmptyStorebagCacheHasTheSizeOfAnEmptyDictionary) {
  const Client a = clientWith(sessionInfo(7));
  const Dictionary payload = report(a);
  EXPECT_EQ(*payload.find("StorebagsCount"), Value(0));
  EXPECT_EQ(*payload.find("StorebagsSize"), Value(objectSizeEstimate(Dictionary(), test_.memory)));
  EXPECT_EQ(*payload.find("CalculatedMemoryUsage"), *payload.find("StorebagsSize"));
}

TEST_F(AgentHealth, MeasuresTheStorebagCacheAnewAfterEachFetch) {
  Client a = clientWith(sessionInfo(7));
  const uint64_t before = report(a).find("StorebagsSize")->unsignedLongLongValue();
  configure(a);
  const Dictionary payload = report(a);
  EXPECT_EQ(*payload.find("StorebagsCount"), Value(1));
  EXPECT_GT(payload.find("StorebagsSize")->unsignedLongLongValue(), before);
}

}  // namespace
}  // namespace kyt
