// Sessions of one hierarchy on several threads, with the real back ends: what the thread sanitizer watches.
#include <atomic>
#include <chrono>
#include <future>
#include <memory>
#include <thread>
#include <vector>

#include "backends/BackendTable.h"
#include "daemon/ReportingdAgent.h"
#include "platform/fake/FakeProcessTransaction.h"
#include "platform/ipc/fake/FakeListener.h"
#include "tests/daemon/AgentFixture.h"

namespace kyt {
namespace {

TEST_F(AgentFixture, SessionsOfOneHierarchyMayChangeEachOtherFromManyThreads) {
  const Dictionary entry{{"post_url", "https://post.example.org"}, {"event_threshold", 5}};
  serve(releaseBag(Dictionary{{"httppost", Dictionary{{"clients", Array{entry}}}}}));
  // The platform of the fixture, but with a deflate that several threads may use.
  Platform& fakes = test_.platform;
  Platform platform{
      .limits = fakes.limits,
      .counters = fakes.counters,
      .log = fakes.log,
      .clock = fakes.clock,
      .timers = fakes.timers,
      .reactor = fakes.reactor,
      .executor = fakes.executor,
      .largeWork = fakes.largeWork,
      .random = fakes.random,
      .userDefaults = fakes.userDefaults,
      .deviceProperties = fakes.deviceProperties,
      .consent = fakes.consent,
      .cryptography = fakes.cryptography,
      .propertyLists = fakes.propertyLists,
      .json = fakes.json,
      .deflate = test_.zlib,
      .memory = fakes.memory,
      .urlSessions = fakes.urlSessions,
      .udpSockets = fakes.udpSockets,
      .clientBundle = fakes.clientBundle,
      .daemonBundle = fakes.daemonBundle,
      .fileExtensions = fakes.fileExtensions,
      .pluginBundles = fakes.pluginBundles,
      .powerLog = fakes.powerLog,
      .budget = fakes.budget,
      .books = fakes.books,
      .departures = fakes.departures,
  };
  Configuration configuration{platform, test_.deviceIdentity, test_.environment};
  DefaultBackendFactory factory(configuration, backendTable(configuration));
  ReportingdSessionClass sessionClass(configuration, factory, messageLog_);
  ReportingdAgent agent(configuration, fetcher_, sessionClass, transaction_);
  listener_.setDelegate(agent);
  test_.log.setLevel(LogLevel::error);

  constexpr int kThreads = 4, kRounds = 15;
  std::atomic<bool> done{false};
  std::jthread drain([&] {
    while (!done) {
      if (test_.executor.runAll() == 0) std::this_thread::yield();
    }
  });
  std::atomic<int> answered{0};
  const auto client = [&](int level) {
    for (int round = 0; round < kRounds; ++round) {
      auto connection =
          std::make_shared<FakeConnection>(SerialQueue::create("test.connection", test_.executor), 1000);
      connection->setEntitlement(kEntitlement, true);
      if (!listener_.connect(connection)) continue;
      Dictionary info = sessionInfoAt(level, "T", static_cast<uint32_t>(level));
      info.set(kKYTReportingSessionInfoBatchEvent, true);
      const auto call = [&](auto work) { connection->call(work); };
      call([&](ClientSessionInterface& s) { s.setSessionInfo(info, std::nullopt, nullptr, round % 2 == 0); });
      call([&](ClientSessionInterface& s) { s.startConfigWithCompletionHandler(nullptr); });
      for (unsigned i = 0; i < 8; ++i) {
        call([&](ClientSessionInterface& s) {
          s.sendMessageWithDictionary(
              Dictionary{{"Category", i}, {"Type", 1}, {"Payload", Dictionary{{"k", round}}}}, nullptr);
        });
        call([&](ClientSessionInterface& s) { s.updateSharedDataForKey("shared", round); });
      }
      call([&](ClientSessionInterface& s) {
        s.flushMessagesWithCompletion([&](Value, std::optional<Error>) { ++answered; });
      });
      connection->invalidateNow();
    }
  };
  test_.urlSessions.setResponder(
      [&](const URLRequest& request) -> std::optional<FakeURLSessionFactory::Reply> {
        FakeURLSessionFactory::Reply reply;
        if (request.method == "GET") {
          reply.body = signedBag(releaseBag(Dictionary{{"httppost", Dictionary{{"clients", Array{entry}}}}}),
                                 test_.propertyLists);
        }
        return reply;
      });
  {
    std::vector<std::jthread> threads;
    for (int level = 0; level < kThreads; ++level) threads.emplace_back(client, level);
  }
  done = true;
  drain.join();
  EXPECT_EQ(answered, kThreads * kRounds);
  EXPECT_EQ(agent.sessionCount(), 0U);
  EXPECT_TRUE(agent.waitUntilSessionsHaveEnded(std::chrono::seconds(30)));
  EXPECT_FALSE(transaction_.outOfOrder());
}

// As when a storebag is being downloaded for somebody else.
TEST_F(AgentFixture, ASessionWithoutATokenIdentifiesItselfWhileTheMonitorIsHeld) {
  Client client = connect(), noToken = connect();
  Dictionary levelAlone = sessionInfo();
  levelAlone.set(kKYTReportingSessionInfoHierarchyToken, Dictionary{{kKYTReportingHierarchyTokenLevel, 2}});
  std::promise<void> done;
  std::future<void> isDone = done.get_future();
  std::thread calls;
  {
    MonitorLock held(agent_.monitor());
    calls = std::thread([&] {
      identify(client, sessionInfo(7, 5), true);
      identify(noToken, levelAlone);
      done.set_value();
    });
    EXPECT_EQ(isDone.wait_for(std::chrono::seconds(20)), std::future_status::ready);
  }
  calls.join();
  EXPECT_TRUE(client.session->hasAggregator());
  EXPECT_TRUE(
      logged(LogLevel::normal,
             "updateCorrelatedSessions: Session 5 has no correlated sessions as it is a standalone session"));
}

}  // namespace
}  // namespace kyt
