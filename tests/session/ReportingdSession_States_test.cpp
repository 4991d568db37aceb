// States, the combined session ID, aggregation and shared data.
#include "tests/session/SessionFixture.h"

namespace kyt {
namespace {

class SessionStates : public SessionFixture {
 protected:
  Client newConfigured(std::initializer_list<const char*> names, const Dictionary& info) {
    Client client = newClient();
    configure(client, names, info);
    return client;
  }
};

TEST_F(SessionStates, ReportsEnabledAndHeldBackEnds) {
  factory_.prepare = [](RecordingBackend& made) {
    if (made.name() == "dashboard") made.stateAfterUpdate = kBackendStateHeld;
    if (made.name() == "qdx") made.stateAfterUpdate = kBackendStateDisabled;
    if (made.name() == "ampyx") made.stateAfterUpdate = kBackendStateUndecided;
  };
  EXPECT_EQ(configure({"qdx", "httppost", "ampyx", "dashboard"}), (Array{"httppost", "dashboard"}));
}

TEST_F(SessionStates, ReportsNoneWithoutBackEnds) {
  EXPECT_FALSE(client_.session->fetchReportingStates());
}

TEST_F(SessionStates, ReportsAnEmptyListWhenNoBackEndIsLive) {
  factory_.prepare = [](RecordingBackend& made) { made.stateAfterUpdate = kBackendStateDisabled; };
  EXPECT_EQ(configure({"httppost", "dashboard"}), Array());
}

// Others of a hierarchy write them too; a session of none need not wait for somebody's download.
TEST_F(SessionStates, AreDecidedUnderTheAgentsLockInAHierarchyAlone) {
  std::vector<bool> locked;
  factory_.prepare = [&](RecordingBackend& made) {
    made.onUpdateState = [&] { locked.push_back(delegate_.isLocked()); };
  };
  configure(client_, {"httppost"}, sessionInfo());
  EXPECT_EQ(locked, std::vector<bool>{false});
  configure(client_, {"httppost"}, sessionInfoAtLevel(0));
  EXPECT_EQ(locked, (std::vector<bool>{false, true}));
}

TEST_F(SessionStates, CopiesTheParentsStateAndThreshold) {
  const Client parent = newConfigured({"httppost"}, sessionInfoAtLevel(0));
  factory_.latest("httppost")->setState(kBackendStateEnabled);
  factory_.latest("httppost")->setSamplingThreshold(12.5);
  configure(client_, {"httppost"}, sessionInfoAtLevel(1));
  backend("httppost").setState(kBackendStateDisabled);
  delegate_.parent = parent.session;
  client_.session->syncReportingStates();
  EXPECT_EQ(backend("httppost").state(), kBackendStateEnabled);
  EXPECT_EQ(backend("httppost").samplingThreshold(), Value(12.5));
  EXPECT_TRUE(logged(
      LogLevel::debug,
      "HTTPSPostBackend(syncReportingStates): httppost: state and sampling rate updated to 2, 12.50%"));
}

// As a double it would be 0.61499…, and so 0.61.
TEST_F(SessionStates, ShowsTheThresholdAsASinglePrecisionNumber) {
  const Client parent = newConfigured({"httppost"}, sessionInfoAtLevel(0));
  factory_.latest("httppost")->setSamplingThreshold(0.615);
  configure(client_, {"httppost"}, sessionInfoAtLevel(1));
  delegate_.parent = parent.session;
  client_.session->syncReportingStates();
  EXPECT_EQ(backend("httppost").samplingThreshold(), Value(0.615));
  EXPECT_TRUE(logged(LogLevel::debug, "state and sampling rate updated to 2, 0.62%"));
}

TEST_F(SessionStates, DisablesABackEndThatTheParentLacks) {
  const Client parent = newConfigured({"dashboard"}, sessionInfoAtLevel(0));
  configure(client_, {"httppost"}, sessionInfoAtLevel(1));
  delegate_.parent = parent.session;
  client_.session->syncReportingStates();
  EXPECT_EQ(backend("httppost").state(), kBackendStateDisabled);
}

TEST_F(SessionStates, NeverOverwritesAHeldBackEnd) {
  const Client parent = newConfigured({"dashboard"}, sessionInfoAtLevel(0));
  configure(client_, {"httppost", "dashboard"}, sessionInfoAtLevel(1));
  backend("httppost").setState(kBackendStateHeld);
  backend("dashboard").setState(kBackendStateHeld);
  delegate_.parent = parent.session;
  client_.session->syncReportingStates();
  EXPECT_EQ(backend("httppost").state(), kBackendStateHeld);
  EXPECT_EQ(backend("dashboard").state(), kBackendStateHeld);
}

TEST_F(SessionStates, LogsAMissingParentOfADeeperSessionOnly) {
  configure(client_, {"httppost"}, sessionInfoAtLevel(0));
  client_.session->syncReportingStates();
  EXPECT_EQ(test_.sink.count("syncReportingStates"), 0U);
  configure(client_, {"httppost"}, sessionInfoAtLevel(2));
  client_.session->syncReportingStates();
  EXPECT_TRUE(logged(
      LogLevel::normal,
      "syncReportingStates: child session 42 (backend httppost) with hierarchy 2 is missing its parent"));
  EXPECT_EQ(backend("httppost").state(), kBackendStateEnabled);
}

TEST_F(SessionStates, CombinesItsIDWithTheParents) {
  configure({"httppost"});
  client_.session->updateCombinedSessionID();
  EXPECT_TRUE(backend("httppost").correlatedIDs.empty());
  delegate_.parentID = String("A.B");
  client_.session->updateCombinedSessionID();
  const std::string combined = "A.B." + client_.session->sessionIDString().str();
  ASSERT_EQ(backend("httppost").correlatedIDs.size(), 1U);
  EXPECT_EQ(backend("httppost").correlatedIDs[0].text(), String(combined));
  EXPECT_TRUE(logged(LogLevel::debug, "updateCombinedSessionID: Updating combined session ID '" + combined +
                                          "' for session 42 backends"));
}

TEST_F(SessionStates, AddsUpWhatItsBackEndsHold) {
  EXPECT_EQ(client_.session->batchedEventsSize(), 0U);
  configure({"httppost", "httppost2"});
  backend("httppost").batchSize = 5'000'000'000;
  backend("httppost2").batchSize = 7;
  EXPECT_EQ(client_.session->batchedEventsSize(), 5'000'000'007U);
}

class SessionAggregation : public SessionFixture {};

TEST_F(SessionAggregation, SendsNothingWithoutAnAggregator) {
  configure({"httppost"});
  send(message(1, 2));
  EXPECT_TRUE(client_.connection->messagesToClient().empty());
}

TEST_F(SessionAggregation, SendsEachMessageToTheSessionsOwnAggregator) {
  configure({"httppost"});
  client_.session->setSessionInfo(sessionInfo(), userInfo(), nullptr, true);
  backend("httppost").setLists(Array{}, std::nullopt);
  send(message(9, 200, Dictionary{{"k", "v"}}));
  ASSERT_EQ(client_.connection->messagesToClient().size(), 1U) << "whatever the lists say";
  const MessageToClient sent = client_.connection->messagesToClient()[0];
  Dictionary info = sessionInfo();
  info.merge(userInfo());
  EXPECT_EQ(sent.sessionInfo, info);
  EXPECT_EQ(sent.timestamp, test_.clock.timeOfDay().asSeconds());
  EXPECT_EQ(sent.category, 9);
  EXPECT_EQ(sent.type, 200);
  EXPECT_EQ(sent.payload, (Dictionary{{"k", "v"}}));
}

TEST_F(SessionAggregation, UserInformationWinsOverSessionInformation) {
  configure({"httppost"});
  client_.session->setSessionInfo(sessionInfo(), Dictionary{{"ClientType", "mine"}}, nullptr, true);
  send(message(1, 2));
  EXPECT_EQ(*client_.connection->messagesToClient().at(0).sessionInfo->find("ClientType"), Value("mine"));
  EXPECT_FALSE(client_.connection->messagesToClient().at(0).payload);
}

TEST_F(SessionAggregation, PrefersAnAncestorToItself) {
  Client ancestor = newClient();
  configure(client_, {"httppost"}, sessionInfoAtLevel(1));
  client_.session->setHasAggregator(true);
  delegate_.ancestor = ancestor.session;
  send(message(1, 2));
  EXPECT_EQ(ancestor.connection->messagesToClient().size(), 1U);
  EXPECT_TRUE(client_.connection->messagesToClient().empty());
}

// Whose client receives a message notes whether the agent's lock is held then.
class LockNotingConnection final : public Connection, private ClientSessionReplyInterface {
 public:
  LockNotingConnection(FakeSessionDelegate& delegate, std::shared_ptr<SerialQueue> queue)
      : delegate_(delegate), queue_(std::move(queue)) {}
  std::vector<bool> locked;  // at each message

  Value entitlementValue(std::string_view) override { return true; }
  std::string description() const override { return "<noting>"; }
  uint32_t peerUser() const override { return 1000; }
  void setExportedObject(std::shared_ptr<ExportedObject>) override {}
  void setInterruptionHandler(Task) override {}
  void setInvalidationHandler(Task) override {}
  void resume() override {}
  void invalidate() override {}
  void finish() override {}
  ClientSessionReplyInterface& remoteObjectProxy() override { return *this; }
  const std::shared_ptr<SerialQueue>& queue() const override { return queue_; }

 private:
  std::optional<Error> sendMessageToClient(std::optional<Dictionary>, double, uint16_t, uint16_t,
                                           std::optional<Dictionary>) override {
    locked.push_back(delegate_.isLocked());
    return std::nullopt;
  }
  FakeSessionDelegate& delegate_;
  const std::shared_ptr<SerialQueue> queue_;
};

TEST_F(SessionAggregation, HoldsTheAgentsLockUntilTheAncestorHasTheMessage) {
  const auto connection = std::make_shared<LockNotingConnection>(
      delegate_, SerialQueue::create("test.connection", test_.executor));
  delegate_.ancestor = ReportingdSession::initWithSessionDelegate(delegate_, connection, class_);
  configure(client_, {"httppost"}, sessionInfoAtLevel(1));
  ASSERT_EQ(connection->locked.size(), 1U) << "its start message";
  send(message(1, 2));
  EXPECT_EQ(connection->locked, (std::vector<bool>{true, true})) << "it must not end in between";
}

TEST_F(SessionAggregation, IsNotOfferedAMessageWithoutItsParameters) {
  configure({"httppost"});
  client_.session->setHasAggregator(true);
  send(Dictionary{{"Category", 1}});
  EXPECT_TRUE(client_.connection->messagesToClient().empty());
}

TEST_F(SessionAggregation, LogsAClientThatCannotBeReached) {
  configure({"httppost"});
  client_.session->setHasAggregator(true);
  client_.connection->setSendError(Error{"d", 1, "gone"});
  send(message(1, 2));
  EXPECT_TRUE(logged(LogLevel::error, "sendMessageWithDictionary: Failed to get remote object proxy: gone"));
}

TEST_F(SessionAggregation, EndsWithOneMessageOfZeros) {
  client_.session->setSessionInfo(sessionInfo(), std::nullopt, nullptr, true);
  client_.session->shutdownSessionAggregation();
  client_.session->shutdownSessionAggregation();
  EXPECT_EQ(test_.sink.count(LogLevel::debug,
                             "shutdownSessionAggregation: Disable aggregation module for session 42"),
            2U);
  ASSERT_EQ(client_.connection->messagesToClient().size(), 1U);
  const MessageToClient last = client_.connection->messagesToClient()[0];
  EXPECT_FALSE(last.sessionInfo);
  EXPECT_EQ(last.timestamp, 0);
  EXPECT_EQ(last.category, 0);
  EXPECT_EQ(last.type, 0);
  EXPECT_FALSE(last.payload);
  EXPECT_FALSE(client_.session->hasAggregator());
}

TEST_F(SessionAggregation, EndsSilentlyWithoutAnAggregator) {
  client_.session->shutdownSessionAggregation();
  EXPECT_TRUE(client_.connection->messagesToClient().empty());
}

class SessionSharedData : public SessionFixture {};

TEST_F(SessionSharedData, IsPassedToTheAgent) {
  client_.session->updateSharedDataWithDictionary(Dictionary{{"a", 1}, {"b", 2}});
  client_.session->updateSharedDataForKey("c", 3);
  EXPECT_EQ(delegate_.updates,
            (std::vector<Dictionary>{Dictionary{{"a", 1}, {"b", 2}}, Dictionary{{"c", 3}}}));
}

TEST_F(SessionSharedData, AMissingValueRemovesTheKey) {
  client_.session->updateSharedDataForKey("c", nullptr);
  EXPECT_TRUE(delegate_.updates.empty());
  EXPECT_EQ(delegate_.removedKeys, std::vector<std::string>{"c"});
}

}  // namespace
}  // namespace kyt
