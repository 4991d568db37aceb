// The life and configuration of a session.
#include "session/ReportingdSession.h"

#include "platform/UserDefaults.h"
#include "platform/objects/Base64.h"
#include "tests/session/SessionFixture.h"

namespace kyt {
namespace {

class ReportingdSessionLife : public SessionFixture {};

TEST_F(ReportingdSessionLife, HasARandomIdentifierAndALogLine) {
  EXPECT_EQ(client_.session->sessionIDString(), base64(FixedRandom::uuidNumber(1)));
  EXPECT_EQ(client_.session->sessionIDString().size(), 24U);
  EXPECT_TRUE(client_.session->sessionIDString().view().ends_with("=="));
  EXPECT_TRUE(logged(LogLevel::debug,
                     "initWithSessionDelegate: ReportingdSession initWithSessionDelegate:<Delegate>"));
  EXPECT_TRUE(logged(LogLevel::debug, "initWithSessionDelegate: Initialized session with UUID " +
                                          client_.session->sessionIDString().str()));
}

TEST_F(ReportingdSessionLife, RegistersWithTheHierarchyWhenIdentified) {
  client_.session->setSessionInfo(sessionInfoAtLevel(3), std::nullopt, nullptr, true);
  EXPECT_TRUE(logged(LogLevel::debug, "setSessionInfo: Configuring session 42"));
  EXPECT_EQ(client_.session->sessionID(), 42U);
  EXPECT_EQ(client_.session->hierarchyLevel(), 3U);
  EXPECT_EQ(client_.session->hierarchyToken(), String("T"));
  EXPECT_TRUE(client_.session->hasAggregator());
  EXPECT_EQ(delegate_.calls, std::vector<std::string>{"correlated 3"});
}

TEST_F(ReportingdSessionLife, ASecondIdentificationOverwritesTheFirst) {
  client_.session->setSessionInfo(sessionInfoAtLevel(3), userInfo(), nullptr, true);
  client_.session->setSessionInfo(sessionInfo(43), std::nullopt, nullptr, false);
  EXPECT_EQ(client_.session->sessionID(), 43U);
  EXPECT_EQ(client_.session->hierarchyLevel(), 0U);
  EXPECT_FALSE(client_.session->hierarchyToken());
  EXPECT_FALSE(client_.session->userInfo());
  EXPECT_FALSE(client_.session->hasAggregator());
  EXPECT_EQ(delegate_.calls, (std::vector<std::string>{"correlated 3", "correlated 0"}));
}

TEST_F(ReportingdSessionLife, IsConfiguredByItsLatestIdentification) {
  client_.session->setSessionInfo(sessionInfo(42), userInfo("a"), nullptr, false);
  Dictionary later = sessionInfo(43, false);
  later.set(kKYTReportingSessionInfoClientType, 20);
  configure(client_, {"httppost"}, later);
  ASSERT_EQ(factory_.calls().size(), 1U);
  EXPECT_EQ(factory_.calls()[0].sessionInfo, later);
  EXPECT_EQ(factory_.calls()[0].userInfo, std::nullopt) << "the second said nothing of a user";
  EXPECT_EQ(client_.session->sessionInfo(), later);
}

TEST_F(ReportingdSessionLife, TellsItsHierarchyBeforeItsStart) {
  std::vector<std::vector<std::string>> calls;
  delegate_.onDownstreamUpdate = [&] { calls.push_back(backend("httppost").calls); };
  configure({"httppost"});
  EXPECT_EQ(calls, (std::vector<std::vector<std::string>>{{"updateState"}}));
  EXPECT_EQ(backend("httppost").calls, (std::vector<std::string>{"updateState", "send"}));
}

// The fake delegate insists on the lock in every test; here each of these calls comes.
TEST_F(ReportingdSessionLife, HoldsTheAgentsLockForWhatConcernsOthersAndReleasesIt) {
  configure(client_, {"httppost"}, sessionInfoAtLevel(1));
  delegate_.lockedCalls.clear();
  send(message(1, 1));
  EXPECT_EQ(delegate_.lockedCalls, (std::vector<std::string>{"ancestor", "shared"}));
  EXPECT_FALSE(delegate_.isLocked());
  delegate_.lockedCalls.clear();
  client_.session->updateSharedDataWithDictionary(Dictionary{{"k", 1}});
  client_.session->updateSharedDataForKey("k", 2);
  client_.session->updateSharedDataForKey("k", nullptr);
  EXPECT_EQ(delegate_.lockedCalls, (std::vector<std::string>{"update", "update", "remove"}));
  EXPECT_FALSE(delegate_.isLocked());
  delegate_.lockedCalls.clear();
  client_.session->dealloc();
  EXPECT_EQ(delegate_.lockedCalls, (std::vector<std::string>{"health", "ancestor", "shared"}));
  EXPECT_FALSE(delegate_.isLocked());
}

TEST_F(ReportingdSessionLife, TakesAHierarchyTokenThatIsNoDictionaryForNone) {
  Dictionary info = sessionInfo();
  info.set(kKYTReportingSessionInfoHierarchyToken, "T");
  client_.session->setSessionInfo(info, std::nullopt, nullptr, false);
  EXPECT_EQ(client_.session->hierarchyLevel(), 0U);
  EXPECT_FALSE(client_.session->hierarchyToken());
}

TEST_F(ReportingdSessionLife, KnowsATokenThatIsNoTextByItsDescription) {
  Dictionary info = sessionInfo();
  info.set(kKYTReportingSessionInfoHierarchyToken, Dictionary{{kKYTReportingHierarchyTokenTokenID, 5}});
  client_.session->setSessionInfo(info, std::nullopt, nullptr, false);
  EXPECT_EQ(client_.session->hierarchyToken(), String("5"));
  EXPECT_EQ(client_.session->hierarchyLevel(), 0U) << "no level is the top";
}

TEST_F(ReportingdSessionLife, HasALevelButNoTokenWithoutATokenID) {
  Dictionary info = sessionInfo();
  info.set(kKYTReportingSessionInfoHierarchyToken, Dictionary{{kKYTReportingHierarchyTokenLevel, 2}});
  client_.session->setSessionInfo(info, std::nullopt, nullptr, false);
  EXPECT_FALSE(client_.session->hierarchyToken());
  EXPECT_EQ(client_.session->hierarchyLevel(), 2U);
}

TEST_F(ReportingdSessionLife, ReadsANegativeLevelAsAnUnsignedNumber) {
  client_.session->setSessionInfo(sessionInfoAtLevel(-1), std::nullopt, nullptr, false);
  EXPECT_EQ(client_.session->hierarchyLevel(), 4294967295U);
}

TEST_F(ReportingdSessionLife, KeepsUserInformationThatWasNotPromisedWithAnError) {
  client_.session->setSessionInfo(sessionInfo(1, false), userInfo(), nullptr, false);
  EXPECT_TRUE(
      logged(LogLevel::error, "setSessionInfo: Configure session: user info provided without requiring it"));
  EXPECT_EQ(client_.session->userInfo(), userInfo());
  test_.sink.clear();
  client_.session->setSessionInfo(sessionInfo(1, true), userInfo(), nullptr, false);
  EXPECT_EQ(test_.sink.count(LogLevel::error, "setSessionInfo"), 0U);
}

TEST_F(ReportingdSessionLife, StaysWithoutBackEndsWithoutAStorebag) {
  client_.session->setSessionInfo(sessionInfo(), std::nullopt, nullptr, false);
  std::optional<Array> states = Array{"unset"};
  client_.session->startConfigWithCompletionHandler([&](std::optional<Array> s) { states = std::move(s); });
  EXPECT_FALSE(states);
  EXPECT_TRUE(
      logged(LogLevel::debug, "startConfigWithCompletionHandler: Starting configuration for session 42"));
  EXPECT_TRUE(factory_.made().empty());
  EXPECT_TRUE(send(message(1, 2)).isNull());
  EXPECT_TRUE(logged(LogLevel::debug, "sendMessageWithDictionary: No backends available to send message"));
}

TEST_F(ReportingdSessionLife, ConfiguresItsBackEndsFromTheStorebag) {
  test_.deviceProperties.setProperty("UniqueDeviceID", "device");
  client_ = newClient();
  client_.session->setSessionInfo(sessionInfo(), userInfo(), nullptr, false);
  delegate_.storebag = table({"httppost", "dashboard"});
  delegate_.storebagVersion = String("1.5");
  std::optional<Array> states;
  client_.session->startConfigWithCompletionHandler([&](std::optional<Array> s) { states = std::move(s); });
  EXPECT_EQ(states, (Array{"httppost", "dashboard"}));
  EXPECT_EQ(client_.session->storebagVersion(), String("1.5"));
  ASSERT_EQ(factory_.calls().size(), 1U);
  EXPECT_EQ(factory_.calls()[0].table, delegate_.storebag);
  EXPECT_EQ(factory_.calls()[0].sessionInfo, sessionInfo());
  EXPECT_EQ(factory_.calls()[0].userInfo, userInfo());
  EXPECT_EQ(factory_.calls()[0].udid, "device");
  for (const char* name : {"httppost", "dashboard"}) {
    EXPECT_NE(backend(name).connectivity(), nullptr);
    EXPECT_EQ(backend(name).combinedSessionIDString(), client_.session->sessionIDString());
    EXPECT_EQ(backend(name).calls, (std::vector<std::string>{"updateState", "send"}));
  }
  EXPECT_EQ(backend("httppost").connectivity(), backend("dashboard").connectivity());
  EXPECT_EQ(delegate_.calls, (std::vector<std::string>{"correlated 0", "storebag", "downstream"}));
}

TEST_F(ReportingdSessionLife, LeavesADeviceIdentifierOverFortyCharactersEmpty) {
  test_.deviceProperties.setProperty("UniqueDeviceID", std::string(41, 'x'));
  client_ = newClient();
  configure({"httppost"});
  EXPECT_EQ(factory_.calls()[0].udid, "");
}

TEST_F(ReportingdSessionLife, TakesATableWithoutKnownNamesForNoBackEnds) {
  factory_.unknownNames = {"nonsense"};
  EXPECT_FALSE(configure({"nonsense"}));
  std::optional<Error> error;
  client_.session->flushMessagesWithCompletion([&](Value, std::optional<Error> e) { error = std::move(e); });
  EXPECT_EQ(error, (Error{"KYTReportingErrorDomain", -1, "No backends available to send message"}));
}

TEST_F(ReportingdSessionLife, ASecondConfigurationFlushesAndCleansUpTheFirstBackEnds) {
  configure({"httppost"});
  const auto first = factory_.latest("httppost");
  configure({"httppost"});
  const auto second = factory_.latest("httppost");
  ASSERT_NE(first, second);
  EXPECT_EQ(first->calls, (std::vector<std::string>{"updateState", "send", "flush", "cleanup"}));
  EXPECT_EQ(second->calls, (std::vector<std::string>{"updateState", "send"}));
}

TEST_F(ReportingdSessionLife, SendsAShortStartMessage) {
  test_.deviceProperties.setCountryCode("DE");
  configure({"httppost"});
  ASSERT_EQ(backend("httppost").sent.size(), 1U);
  const RecordingBackend::Sent& start = backend("httppost").sent[0];
  EXPECT_EQ(start.method, 0);
  EXPECT_EQ(start.respCode, 0);
  EXPECT_EQ(start.flag, 0);
  EXPECT_EQ(start.eventID, 1);
  EXPECT_EQ(start.timestamp, test_.clock.timeOfDay());
  EXPECT_EQ(start.message,
            (Dictionary{{"ClientData", Dictionary{{"AutomaticTimeSet", true}, {"Locale", "DE"}}}}));
  EXPECT_TRUE(logged(LogLevel::debug, "internalSendMessage: Sent internal message (method:0 respCode:0)"));
  for (const char* key : {"ProductVersion", "BuildVersion", "DeviceName", "SerialNumber", "HWModelStr"})
    EXPECT_EQ(test_.deviceProperties.queries(key), 1) << key;
}

TEST_F(ReportingdSessionLife, SaysUnknownForWhatIsMissing) {
  test_.userDefaults.put(kTimedDefaultsDomain, "TMAutomaticTimeZoneEnabled", false);
  configure({"httppost"});
  EXPECT_EQ(backend("httppost").sent[0].message,
            (Dictionary{{"ClientData", Dictionary{{"AutomaticTimeSet", false}, {"Locale", "Unknown"}}}}));
}

TEST_F(ReportingdSessionLife, TellsMoreOfTheDeviceOnAnInternalBuild) {
  test_.deviceProperties.setProperty("ReleaseType", "Internal");
  test_.deviceProperties.setProperty("ProductVersion", "12");
  test_.deviceProperties.setProperty("BuildVersion", "12A1");
  test_.deviceProperties.setProperty("HWModelStr", "board");
  test_.clientBundle.setVersion(std::nullopt);
  configure({"httppost"});
  EXPECT_EQ(backend("httppost").sent[0].message,
            (Dictionary{{"ClientData", Dictionary{{"SerialNum", "Unknown"},
                                                  {"Version", "12"},
                                                  {"Build", "12A1"},
                                                  {"Hardware", "board"},
                                                  {"Product", "Unknown"},
                                                  {"ReportVers", "8.0"},
                                                  {"Locale", "Unknown"},
                                                  {"AutomaticTimeSet", true}}}}));
}

class ReportingdSessionUserInfo : public SessionFixture {
 protected:
  void fetchStates(std::optional<Dictionary> info) {
    client_.session->fetchStatesWithUserInfo(std::move(info),
                                             [this](std::optional<Array> s) { states_ = s; });
  }
  std::optional<Array> states_;
};

TEST_F(ReportingdSessionUserInfo, UpdatesStatesOnTheFirst) {
  configure({"httppost"});
  fetchStates(userInfo());
  EXPECT_EQ(states_, (Array{"httppost"}));
  EXPECT_TRUE(logged(LogLevel::debug, "fetchStatesWithUserInfo: Fetching states for session 42"));
  EXPECT_TRUE(logged(LogLevel::debug, "receivedUserInfo: Received new user info for session 42"));
  EXPECT_EQ(backend("httppost").userInfoDict(), userInfo());
  EXPECT_EQ(backend("httppost").updateCount, 2);
  EXPECT_EQ(delegate_.count("downstream"), 2);
}

TEST_F(ReportingdSessionUserInfo, IsPassedOnWithoutAStateUpdateWhenTheNamesAreTheSame) {
  configure({"httppost"});
  fetchStates(userInfo());
  Dictionary more = userInfo();
  more.set("More", 1);
  fetchStates(more);
  EXPECT_EQ(backend("httppost").userInfoCount, 2);
  EXPECT_EQ(backend("httppost").userInfoDict(), more);
  EXPECT_EQ(backend("httppost").updateCount, 2);
}

TEST_F(ReportingdSessionUserInfo, CountsAsChangedByEitherName) {
  configure({"httppost"});
  fetchStates(userInfo("a", "s"));
  fetchStates(userInfo("b", "s"));
  EXPECT_EQ(backend("httppost").updateCount, 3);
  fetchStates(userInfo("b", "t"));
  EXPECT_EQ(backend("httppost").updateCount, 4);
}

TEST_F(ReportingdSessionUserInfo, AMissingNameOnTheNewSideAlwaysCountsAsChanged) {
  configure({"httppost"});
  const Dictionary nameless{{"Other", 1}};
  fetchStates(nameless);
  fetchStates(nameless);
  EXPECT_EQ(backend("httppost").updateCount, 3);
}

TEST_F(ReportingdSessionUserInfo, StaysWhenNoneComesAlthoughItIsRequired) {
  configure({"httppost"});
  fetchStates(userInfo());
  fetchStates(std::nullopt);
  EXPECT_EQ(client_.session->userInfo(), userInfo());
  EXPECT_EQ(backend("httppost").userInfoCount, 1);
}

TEST_F(ReportingdSessionUserInfo, GoesWhenNoneComesAndItIsNotRequired) {
  configure(client_, {"httppost"}, sessionInfo(42, false));
  fetchStates(userInfo());
  fetchStates(std::nullopt);
  EXPECT_FALSE(client_.session->userInfo());
  EXPECT_FALSE(backend("httppost").userInfoDict());
  EXPECT_EQ(backend("httppost").updateCount, 3);
}

TEST_F(ReportingdSessionUserInfo, NoneOnNoneDoesNothing) {
  configure({"httppost"});
  fetchStates(std::nullopt);
  EXPECT_EQ(backend("httppost").userInfoCount, 0);
  EXPECT_EQ(states_, (Array{"httppost"}));
}

TEST_F(ReportingdSessionUserInfo, TheDigestKeyGoesToOneBackEndAndItsAlgorithmIsForgotten) {
  configure({"httppost", "qrs"});
  client_.session->setDigestKey(Data("secret"), 5);
  EXPECT_EQ(backend("qrs").digestKey(), Data("secret"));
  EXPECT_EQ(backend("qrs").digestAlgorithm(), 5);
  EXPECT_FALSE(backend("httppost").digestKey());
  fetchStates(userInfo());
  EXPECT_EQ(backend("qrs").digestKey(), Data("secret"));
  EXPECT_EQ(backend("qrs").digestAlgorithm(), 0);
  EXPECT_FALSE(backend("httppost").digestKey());
}

TEST_F(ReportingdSessionUserInfo, AKeyThatCameBeforeTheBackEndsIsHandedOverLater) {
  client_.session->setDigestKey(Data("secret"), 5);
  configure({"qrs"});
  EXPECT_FALSE(backend("qrs").digestKey());
  fetchStates(userInfo());
  EXPECT_EQ(backend("qrs").digestKey(), Data("secret"));
}

class ReportingdSessionDisplayURL : public SessionFixture {
 protected:
  std::string displayURL() {
    std::string answer;
    client_.session->fetchDisplayURL([&](String text) { answer = text.str(); });
    return answer;
  }
};

TEST_F(ReportingdSessionDisplayURL, IsNotAvailableWithoutBackEnds) {
  EXPECT_EQ(displayURL(), "URL not available");
  EXPECT_TRUE(logged(LogLevel::debug, "fetchDisplayURL: Fetching display URL for session 0"));
}

TEST_F(ReportingdSessionDisplayURL, IsTheFirstPostersThenTheSecondsThenTheDashboards) {
  configure({"dashboard", "httppost2", "httppost"});
  EXPECT_EQ(displayURL(), "URL not available");
  backend("dashboard").setDisplayURL(String("d"));
  EXPECT_EQ(displayURL(), "d");
  backend("httppost2").setDisplayURL(String("h2"));
  EXPECT_EQ(displayURL(), "h2");
  backend("httppost").setDisplayURL(String("h1"));
  EXPECT_EQ(displayURL(), "h1");
}

TEST_F(ReportingdSessionDisplayURL, IsTheDashboardsWhenThereIsNoOther) {
  configure({"dashboard"});
  backend("dashboard").setDisplayURL(String("d"));
  EXPECT_EQ(displayURL(), "d");
}

class ReportingdSessionEnd : public SessionFixture {};

TEST_F(ReportingdSessionEnd, SendsAStopMessageThenFlushesThenCleansUp) {
  configure({"httppost"});
  const auto backend = factory_.latest("httppost");
  client_.session->finishSessionGracefully();
  EXPECT_TRUE(logged(LogLevel::debug, "finishSessionGracefully: Session 42 has been finished gracefully"));
  client_.session->dealloc();
  EXPECT_TRUE(logged(LogLevel::debug, "dealloc: ReportingdSession dealloc: 42"));
  EXPECT_EQ(backend->calls, (std::vector<std::string>{"updateState", "send", "send", "flush", "cleanup"}));
  const RecordingBackend::Sent& stop = backend->sent[1];
  EXPECT_EQ(stop.method, 0);
  EXPECT_EQ(stop.respCode, 1);
  EXPECT_EQ(
      stop.message,
      (Dictionary{{"ClientData",
                   Dictionary{{"StorebagVersion", "1.5"}, {"GracefulTermination", true}, {"Health", 1}}}}));
  EXPECT_EQ(client_.session->connection(), nullptr);
}

TEST_F(ReportingdSessionEnd, SaysSoWhenItWasNotGraceful) {
  configure({"httppost"});
  client_.session->dealloc();
  EXPECT_EQ(*factory_.latest("httppost")
                 ->sent[1]
                 .message.find("ClientData")
                 ->dictionary()
                 ->find("GracefulTermination"),
            Value(false));
}

TEST_F(ReportingdSessionEnd, TheStopMessageHasNoVersionWhenTheSessionGotNone) {
  configure({"httppost"});
  client_.session->setStorebagVersion(std::nullopt);
  client_.session->dealloc();
  EXPECT_EQ(factory_.latest("httppost")->sent[1].message,
            (Dictionary{{"ClientData", Dictionary{{"Health", 1}}}}));
}

TEST_F(ReportingdSessionEnd, WithoutBackEndsOnlyEndsAggregation) {
  client_.session->setSessionInfo(sessionInfo(), std::nullopt, nullptr, true);
  client_.session->dealloc();
  EXPECT_EQ(test_.sink.count("flushMessagesWithCompletion"), 0U);
  EXPECT_EQ(test_.sink.count("internalSendMessage"), 0U);
  EXPECT_EQ(client_.connection->messagesToClient().size(), 1U);
}

TEST_F(ReportingdSessionEnd, AFlushAnswerAfterTheEndIsHarmless) {
  factory_.prepare = [](RecordingBackend& backend) { backend.holdsFlushes = true; };
  configure({"httppost"});
  const auto backend = factory_.latest("httppost");
  client_.session->dealloc();
  client_.session.reset();
  ASSERT_EQ(backend->flushes.size(), 1U);
  backend->flushes[0]("late", std::nullopt);
  EXPECT_EQ(messageLog_.lines(), std::vector<std::string>{"[httppost -> flushMessages] late"});
}

TEST_F(ReportingdSessionEnd, LetsGoOfWhatItHeldAlthoughSomebodyStillHoldsTheSession) {
  configure(client_, {"httppost"}, sessionInfoAtLevel(1));
  client_.session->dealloc();
  EXPECT_EQ(test_.urlSessions.sessionsInvalidated(), 1U);
  EXPECT_EQ(client_.session->connection(), nullptr);
  EXPECT_FALSE(client_.session->hierarchyToken());
  EXPECT_FALSE(client_.session->sessionInfo());
  client_.session->sendToAggregator(std::nullopt, 1, 2, 3, std::nullopt);
  EXPECT_TRUE(client_.connection->messagesToClient().empty()) << "nothing is sent after the end";
}

TEST_F(SessionFixture, CountsKeysOfTheSessionInformationThatMeanNothing) {
  Dictionary info = sessionInfoAtLevel(0);
  info.set("RequireUserinfo", true);
  info.set("clientversion", 3);
  Dictionary token = *info.find("HierarchyToken")->dictionary();
  token.set("level", 1);
  info.set("HierarchyToken", token);
  client_.session->setSessionInfo(info, std::nullopt, nullptr, false);
  EXPECT_EQ(test_.counters.value(Reason::sessionInfoKeyUnknown), 3U);
  EXPECT_EQ(test_.counters.value(Reason::sessionInfoValueMistyped), 0U);
  EXPECT_EQ(test_.sink.count(LogLevel::normal,
                             "setSessionInfo: The session information has an entry RequireUserinfo that "
                             "means nothing here"),
            1U);
  EXPECT_EQ(test_.sink.count("means nothing here"), 1U) << "once a minute";
}

TEST_F(SessionFixture, CountsValuesOfTheSessionInformationOfAWrongType) {
  Dictionary info{{"SessionID", "42"},  {"ClientType", true},     {"ClientVersion", Array()},
                  {"BatchEvent", "on"}, {"RequireUserInfo", "1"}, {"HierarchyToken", 5}};
  client_.session->setSessionInfo(info, std::nullopt, nullptr, false);
  EXPECT_EQ(test_.counters.value(Reason::sessionInfoValueMistyped), 6U);
  EXPECT_EQ(client_.session->sessionID(), 42U) << "it is served all the same";
  EXPECT_TRUE(logged(LogLevel::normal,
                     "setSessionInfo: The session information has an entry SessionID of a wrong type"));
  info = Dictionary{{"SessionID", 42},
                    {"ClientType", 7U},
                    {"ClientVersion", 1.0},
                    {"BatchEvent", 1},
                    {"RequireUserInfo", false}};
  client_.session->setSessionInfo(info, std::nullopt, nullptr, false);
  EXPECT_EQ(test_.counters.value(Reason::sessionInfoValueMistyped), 6U);
  EXPECT_EQ(test_.counters.value(Reason::sessionInfoKeyUnknown), 0U);
}

TEST_F(SessionFixture, CountsTheInformationOfASingleMessageToo) {
  Dictionary info = sessionInfo();
  info.set("Service", "x");
  client_.session->sendMessageWithSessionInfo(info, std::nullopt, 1, 2, std::nullopt, nullptr);
  EXPECT_EQ(test_.counters.value(Reason::sessionInfoKeyUnknown), 1U);
}

class SessionInformation : public SessionFixture {
 protected:
  // A session of a user whose clients may hold so many bytes.
  Client clientOfUser(uint64_t bytes) {
    test_.budget.shares()[Share::bytes] = bytes;
    account_ = test_.budget.account(1000);
    auto connection =
        std::make_shared<FakeConnection>(SerialQueue::create("test.connection", test_.executor), 1000);
    connection->setUserAccount(account_);
    connection->resume();
    auto session = ReportingdSession::initWithSessionDelegate(delegate_, connection, class_);
    return {std::move(connection), std::move(session)};
  }
  [[nodiscard]] uint64_t held() const { return account_->holds(Share::bytes); }

  std::shared_ptr<UserAccount> account_;
};

TEST_F(SessionInformation, CountsTowardsItsUserUntilTheEnd) {
  const Client client = clientOfUser(1u << 20);
  Dictionary user = userInfo();
  client.session->setSessionInfo(sessionInfo(), user, nullptr, false);
  EXPECT_EQ(held(), 0U) << "so little counts with the connection";
  user.set("more", std::string(100000, 'x'));
  client.session->setSessionInfo(sessionInfo(), user, nullptr, false);
  EXPECT_GE(held(), 100000U);
  EXPECT_LT(held(), 110000U) << "once";
  client.session->setSessionInfo(sessionInfo(), userInfo(), Value(std::string(200000, 'f')), false);
  EXPECT_GE(held(), 200000U);
  client.session->setDigestKey(Data(std::string(50000, 'k')), 0);
  EXPECT_GE(held(), 250000U);
  client.session->dealloc();
  EXPECT_EQ(held(), 0U);
}

TEST_F(SessionInformation, WithoutRoomEndsItsConnection) {
  const Client client = clientOfUser(50000);
  Dictionary user = userInfo();
  user.set("more", std::string(40000, 'x'));
  client.session->setSessionInfo(sessionInfo(), user, nullptr, false);
  test_.executor.runAll();
  EXPECT_FALSE(client.connection->invalidated());
  user.set("more", std::string(60000, 'x'));
  client.session->setSessionInfo(sessionInfo(), user, nullptr, false);
  test_.executor.runAll();
  EXPECT_TRUE(client.connection->invalidated());
  EXPECT_GE(held(), 60000U) << "it is there until the session ends";
  EXPECT_EQ(test_.counters.value(Reason::userBytesExceeded), 1U);
  EXPECT_TRUE(logged(LogLevel::error,
                     "setSessionInfo: User 1000 holds too many bytes for the information of session 42"));
  client.session->dealloc();
  EXPECT_EQ(held(), 0U);
}

}  // namespace
}  // namespace kyt
