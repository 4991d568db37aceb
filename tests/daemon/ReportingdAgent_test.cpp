// Connections and the list of live sessions.
#include "daemon/ReportingdAgent.h"

#include "tests/daemon/AgentFixture.h"

namespace kyt {
namespace {

class AgentConnections : public AgentFixture {};

TEST_F(AgentConnections, AnEntitledConnectionGetsASession) {
  const Client client = connect();
  ASSERT_TRUE(client);
  EXPECT_TRUE(client.connection->resumed());
  EXPECT_EQ(agent_.sessionCount(), 1U);
  EXPECT_TRUE(logged(
      LogLevel::debug,
      "listener: Accepting new VRP connection <connection> as it has proper entitlement, 0(0) connections."));
  clientWith(sessionInfoAt(0));
  connect();
  EXPECT_TRUE(logged(LogLevel::debug, "as it has proper entitlement, 2(1) connections."));
}

TEST_F(AgentConnections, AConnectionWithoutTheEntitlementIsRefused) {
  for (const Value& entitlement :
       {Value(), Value(false), Value(0), Value("no"), Value(Dictionary{{"a", 1}})}) {
    test_.sink.clear();
    EXPECT_FALSE(connect(entitlement));
    EXPECT_EQ(
        test_.sink.lines(),
        (std::vector<MemoryLogSink::Line>{
            {LogLevel::debug,
             "listener: new VRP connection <connection> does not have required kytreporting entitlement. Closing connection..."}}));
  }
  EXPECT_EQ(agent_.sessionCount(), 0U);
  EXPECT_EQ(transaction_.begins(), 0);
}

// At the default level, where an administrator looks for the reason.
TEST_F(AgentConnections, ARefusalIsToldOnceAMinuteForEachUser) {
  test_.log.setLevel(LogLevel::normal);
  const auto refusalsTold = [this](uint32_t user) {
    test_.sink.clear();
    EXPECT_FALSE(connect(Value(), user));
    return test_.sink.lines();
  };
  const auto lineFor = [](const char* user) {
    return std::vector<MemoryLogSink::Line>{
        {LogLevel::normal,
         std::string("listener: Refused connection <connection>: no grant gives it the entitlement, see "
                     "\"kytctl entitlements check --user ") +
             user + "\""}};
  };
  const std::vector<MemoryLogSink::Line> nothing;
  EXPECT_EQ(refusalsTold(1000), lineFor("1000"));
  EXPECT_EQ(refusalsTold(1000), nothing);
  EXPECT_EQ(refusalsTold(0), lineFor("0"));
  test_.clock.advance(std::chrono::seconds(59));
  EXPECT_EQ(refusalsTold(1000), nothing);
  test_.clock.advance(std::chrono::seconds(1));
  EXPECT_EQ(refusalsTold(1000), lineFor("1000"));
  EXPECT_TRUE(connect(true, 1000));
}

TEST_F(AgentConnections, TheTransactionIsOpenWhileASessionIsListed) {
  const Client first = connect();
  EXPECT_TRUE(transaction_.isOpen());
  const Client second = connect();
  EXPECT_EQ(transaction_.begins(), 1);
  first.connection->invalidateNow();
  EXPECT_TRUE(transaction_.isOpen());
  second.connection->invalidateNow();
  EXPECT_FALSE(transaction_.isOpen());
  EXPECT_EQ(transaction_.ends(), 1);
  connect();
  EXPECT_EQ(transaction_.begins(), 2);
  EXPECT_FALSE(transaction_.outOfOrder());
}

TEST_F(AgentConnections, AnInterruptionAloneKeepsTheSession) {
  const Client client = connect();
  const std::string description = client.session->description();
  client.connection->interruptNow();
  EXPECT_EQ(agent_.sessionCount(), 1U);
  EXPECT_TRUE(logged(LogLevel::debug, "listener: VRP connection to " + description + " was interrupted"));
  EXPECT_FALSE(logged(LogLevel::debug, "was invalidated"));
  client.connection->invalidateNow();
  EXPECT_EQ(agent_.sessionCount(), 0U);
  EXPECT_TRUE(logged(LogLevel::debug, "listener: VRP connection to " + description + " was invalidated"));
}

TEST_F(AgentConnections, AnInvalidationEndsTheSessionAfterItLeftTheList) {
  Client client = clientWith(sessionInfo(7));
  configure(client);
  const auto backend = factory_.latest("httppost");
  std::weak_ptr<ReportingdSession> session = client.session;
  client.session.reset();
  client.connection->invalidateNow();
  ASSERT_EQ(backend->sent.size(), 2U);
  EXPECT_EQ(backend->cleanupCount, 1);
  const Dictionary& stop = *backend->sent[1].message.find("ClientData")->dictionary();
  EXPECT_EQ(*stop.find("SessionsCount_QH"), Value(1)) << "counted once: it has left the list";
  EXPECT_TRUE(session.expired());
}

TEST_F(AgentConnections, InvalidatingASessionThatIsNotListedChangesNothing) {
  const Client client = connect();
  client.connection->invalidateNow();
  agent_.invalidateReportingSession(client.session);
  EXPECT_EQ(agent_.sessionCount(), 0U);
  EXPECT_FALSE(transaction_.outOfOrder());
  const Client other = connect();
  agent_.invalidateReportingSession(client.session);
  EXPECT_EQ(agent_.sessionCount(), 1U);
  EXPECT_TRUE(transaction_.isOpen());
}

TEST_F(AgentConnections, ATokensArrayAndSharedDataStayWhenItsSessionsHaveGone) {
  Client first = clientWith(sessionInfoAt(0));
  first.session->updateSharedDataWithDictionary(Dictionary{{"k", 1}});
  first.connection->invalidateNow();
  EXPECT_EQ(agent_.hierarchyTokenCount(), 1U);
  Client second = clientWith(sessionInfoAt(0));
  EXPECT_EQ(agent_.sharedDataForSession(*second.session), (Dictionary{{"k", 1}}));
}

TEST_F(AgentConnections, ShutDownRefusesNewConnectionsAndFinishesTheOthers) {
  Client client = clientWith(sessionInfo());
  configure(client);
  EXPECT_FALSE(agent_.waitUntilSessionsHaveEnded(Duration(0)));
  agent_.finishAllSessions();
  test_.executor.runAll();
  EXPECT_TRUE(agent_.waitUntilSessionsHaveEnded(std::chrono::seconds(30)));
  EXPECT_TRUE(client.connection->invalidated());
  EXPECT_EQ(factory_.latest("httppost")->cleanupCount, 1);
  EXPECT_FALSE(connect());
}

// Its entitlement is asked for while a shut-down begins, so its session misses the shut-down's look at the
// list.
class LateConnection final : public Connection, private ClientSessionReplyInterface {
 public:
  LateConnection(ReportingdAgent& agent, std::shared_ptr<SerialQueue> queue)
      : agent_(agent), queue_(std::move(queue)) {}
  bool finished = false;

  Value entitlementValue(std::string_view) override {
    agent_.finishAllSessions();
    return true;
  }
  std::string description() const override { return "<late>"; }
  uint32_t peerUser() const override { return 1000; }
  void setExportedObject(std::shared_ptr<ExportedObject> object) override {
    object_ = std::dynamic_pointer_cast<ClientSessionInterface>(std::move(object));
  }
  void setInterruptionHandler(Task handler) override { interruption_ = std::move(handler); }
  void setInvalidationHandler(Task handler) override { invalidation_ = std::move(handler); }
  void resume() override {}
  void invalidate() override {
    object_.reset();
    interruption_.reset();
    if (Task invalidation = std::move(invalidation_)) invalidation();
  }
  void finish() override { finished = true; }
  ClientSessionReplyInterface& remoteObjectProxy() override { return *this; }
  const std::shared_ptr<SerialQueue>& queue() const override { return queue_; }

 private:
  std::optional<Error> sendMessageToClient(std::optional<Dictionary>, double, uint16_t, uint16_t,
                                           std::optional<Dictionary>) override {
    return std::nullopt;
  }
  ReportingdAgent& agent_;
  const std::shared_ptr<SerialQueue> queue_;
  std::shared_ptr<ClientSessionInterface> object_;
  Task interruption_, invalidation_;
};

TEST_F(AgentConnections, ASessionThatAppearsDuringAShutDownIsFinishedToo) {
  const auto connection =
      std::make_shared<LateConnection>(agent_, SerialQueue::create("test.connection", test_.executor));
  EXPECT_TRUE(agent_.listenerShouldAcceptNewConnection(listener_, connection));
  EXPECT_TRUE(connection->finished);
  EXPECT_FALSE(agent_.waitUntilSessionsHaveEnded(Duration(0)));
  connection->invalidate();
  EXPECT_TRUE(agent_.waitUntilSessionsHaveEnded(Duration(0)));
}

}  // namespace
}  // namespace kyt
