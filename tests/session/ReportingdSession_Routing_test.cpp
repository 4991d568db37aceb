// The two doors for messages.
#include <thread>

#include "session/ReportingSessionConnectivityHelper.h"
#include "tests/session/SessionFixture.h"

namespace kyt {
namespace {

class MessageRouting : public SessionFixture {
 protected:
  static Array numbers(std::initializer_list<int> values) {
    Array array;
    for (int value : values) array.append(value);
    return array;
  }
  // The messages after the start message.
  std::vector<RecordingBackend::Sent> sentTo(const char* name) {
    std::vector<RecordingBackend::Sent> sent = backend(name).sent;
    if (!sent.empty()) sent.erase(sent.begin());
    return sent;
  }
};

TEST_F(MessageRouting, DropsAMessageWithoutCategoryOrType) {
  configure({"httppost"});
  EXPECT_TRUE(send(Dictionary()).isNull());
  EXPECT_TRUE(logged(LogLevel::debug, "sendMessageWithDictionary: Missing mandatory parameter 'category'"));
  EXPECT_FALSE(logged(LogLevel::debug, "Missing mandatory parameter 'type'"))
      << "category is looked at first";
  EXPECT_TRUE(send(Dictionary{{"Category", 1}}).isNull());
  EXPECT_TRUE(logged(LogLevel::debug, "sendMessageWithDictionary: Missing mandatory parameter 'type'"));
  EXPECT_TRUE(sentTo("httppost").empty());
}

TEST_F(MessageRouting, WantsATextForAClientThatWaitsWhateverTheMessageLogTakes) {
  configure({"httppost"});
  backend("httppost").answer = Value("text");
  backend("httppost").answersIfWanted = 100;
  messageLog_.setFull(true);
  EXPECT_EQ(send(message(9, 200)), Value("text"));
  EXPECT_TRUE(messageLog_.asked().empty());
  EXPECT_EQ(messageLog_.lines().size(), 1U);
}

TEST_F(MessageRouting, WantsATextThatNoClientWaitsForAsTheMessageLogDoes) {
  configure({"httppost"});
  backend("httppost").answer = Value("text");
  backend("httppost").answersIfWanted = 100;
  client_.session->sendMessageWithDictionary(message(9, 200), nullptr);
  EXPECT_EQ(messageLog_.lines(), std::vector<std::string>{"[httppost -> sendMessageWithDictionary] text"});
  messageLog_.setFull(true);
  client_.session->sendMessageWithDictionary(message(9, 200), nullptr);
  EXPECT_EQ(messageLog_.lines().size(), 1U);
  EXPECT_EQ(messageLog_.asked(), (std::vector<size_t>{100, 100}));
}

TEST_F(MessageRouting, HandsTheMessageToTheBackEnds) {
  configure({"httppost", "qdx"});
  test_.clock.advance(std::chrono::seconds(5));
  Dictionary dictionary = message(9, 200, Dictionary{{"k", "v"}});
  dictionary.set("Flag", 3);
  send(dictionary);
  EXPECT_TRUE(logged(LogLevel::debug, "sendMessageWithDictionary: Sending message for session 42"));
  for (const char* name : {"httppost", "qdx"}) {
    ASSERT_EQ(sentTo(name).size(), 1U);
    const RecordingBackend::Sent sent = sentTo(name)[0];
    EXPECT_EQ(sent.method, 9);
    EXPECT_EQ(sent.respCode, 200);
    EXPECT_EQ(sent.flag, 3);
    EXPECT_EQ(sent.eventID, 2);
    EXPECT_EQ(sent.timestamp, test_.clock.timeOfDay());
    EXPECT_EQ(sent.message, (Dictionary{{"ClientData", Dictionary{{"k", "v"}}}}));
  }
}

TEST_F(MessageRouting, TakesTheTimeOnceForAllBackEndsAndTheAggregator) {
  configure({"httppost", "qdx"});
  client_.session->setHasAggregator(true);
  const TimeValue now = test_.clock.timeOfDay();
  test_.clock.setTick(std::chrono::seconds(1));
  send(message(9, 200));
  EXPECT_EQ(sentTo("httppost").at(0).timestamp, now);
  EXPECT_EQ(sentTo("qdx").at(0).timestamp, now);
  EXPECT_EQ(client_.connection->messagesToClient().at(0).timestamp, now.asSeconds());
  send(message(9, 200));
  EXPECT_EQ(sentTo("qdx").at(1).timestamp.asSeconds(), now.asSeconds() + 1)
      << "the next has a time of its own";
}

TEST_F(MessageRouting, TakesTheTimeOnlyOfAMessageThatHasItsParameters) {
  configure({"httppost"});
  const TimeValue now = test_.clock.timeOfDay();
  test_.clock.setTick(std::chrono::seconds(1));
  send(Dictionary{{"Category", 1}});
  send(message(9, 200));
  EXPECT_EQ(sentTo("httppost").at(0).timestamp, now);
}

// The session reads the clock when it makes the message, and again when it sends it.
TEST_F(MessageRouting, StampsAnInternalMessageAnew) {
  TimeValue begin = test_.clock.timeOfDay();
  test_.clock.setTick(std::chrono::seconds(1));
  configure({"httppost"});
  const auto posts = factory_.latest("httppost");
  EXPECT_GT(posts->sent.at(0).timestamp.asSeconds(), begin.asSeconds()) << "the start message";
  begin.seconds += 1000;
  test_.clock.setTimeOfDay(begin);
  client_.session->dealloc();
  EXPECT_GT(posts->sent.at(1).timestamp.asSeconds(), begin.asSeconds()) << "the stop message";
}

TEST_F(MessageRouting, CutsCategoryAndTypeToTheirLowSixteenBits) {
  configure({"httppost"});
  backend("httppost").setLists(numbers({4}), std::nullopt);
  send(message(65540, 65537));
  ASSERT_EQ(sentTo("httppost").size(), 1U);
  EXPECT_EQ(sentTo("httppost")[0].method, 4);
  EXPECT_EQ(sentTo("httppost")[0].respCode, 1);
}

TEST_F(MessageRouting, SendsAnEmptyEnvelopeWithoutPayloadAndSharedData) {
  configure({"httppost"});
  send(message(1, 2));
  ASSERT_EQ(sentTo("httppost").size(), 1U);
  EXPECT_TRUE(sentTo("httppost")[0].message.empty());
}

TEST_F(MessageRouting, TakesAPayloadThatIsNoDictionaryForMissing) {
  configure({"httppost"});
  send(message(1, 2, "text"));
  EXPECT_TRUE(sentTo("httppost").at(0).message.empty());
}

TEST_F(MessageRouting, AddsTheSharedDataOfTheHierarchy) {
  configure(client_, {"httppost"}, sessionInfoAtLevel(0));
  delegate_.sharedData = Dictionary{{"shared", 1}};
  send(message(1, 2, Dictionary{{"own", 2}}));
  EXPECT_EQ(sentTo("httppost").at(0).message,
            (Dictionary{{"SharedData", Dictionary{{"shared", 1}}}, {"ClientData", Dictionary{{"own", 2}}}}));
}

TEST_F(MessageRouting, TestsEachBackEndsListsOnTheirOwn) {
  configure({"httppost", "dashboard"});
  backend("httppost").setLists(numbers({7}), std::nullopt);
  backend("dashboard").setLists(std::nullopt, numbers({7}));
  send(message(7, 1));
  EXPECT_EQ(sentTo("httppost").size(), 1U);
  EXPECT_TRUE(sentTo("dashboard").empty());
  EXPECT_TRUE(logged(
      LogLevel::debug,
      "sendMessageWithDictionary: Dropping event with category 7 as it is blacklisted for backend dashboard"));
  send(message(8, 1));
  EXPECT_EQ(sentTo("httppost").size(), 1U);
  EXPECT_EQ(sentTo("dashboard").size(), 1U);
  EXPECT_TRUE(logged(
      LogLevel::debug,
      "sendMessageWithDictionary: Dropping event with category 8 as it is not whitelisted for backend httppost"));
}

TEST_F(MessageRouting, LooksAtTheWhiteListFirst) {
  configure({"httppost"});
  backend("httppost").setLists(numbers({}), numbers({7}));
  send(message(7, 1));
  EXPECT_TRUE(logged(LogLevel::debug, "category 7 as it is not whitelisted"));
  EXPECT_FALSE(logged(LogLevel::debug, "category 7 as it is blacklisted"));
}

TEST_F(MessageRouting, InternalMessagesAreSubjectToTheListsToo) {
  factory_.prepare = [](RecordingBackend& backend) { backend.setLists(std::nullopt, Array{0}); };
  configure({"httppost"});
  EXPECT_TRUE(backend("httppost").sent.empty());
}

TEST_F(MessageRouting, AnswersWhatAPosterReturned) {
  configure({"dashboard", "httppost"});
  backend("dashboard").answer = "from the dashboard";
  backend("httppost").answer = "from the poster";
  EXPECT_EQ(send(message(1, 1)), Value("from the poster"));
  backend("httppost").answer = nullptr;
  EXPECT_EQ(send(message(1, 1)), Value("from the dashboard"));
}

TEST_F(MessageRouting, APostersAnswerIsNotReplacedByTheDashboardsThatComesLater) {
  configure({"httppost2", "dashboard"});
  backend("dashboard").answer = "from the dashboard";
  backend("httppost2").answer = "from the poster";
  EXPECT_EQ(send(message(1, 1)), Value("from the poster"));
}

TEST_F(MessageRouting, OfTwoPostersTheLastAnswers) {
  configure({"httppost", "httppost2"});
  backend("httppost").answer = "one";
  backend("httppost2").answer = "two";
  EXPECT_EQ(send(message(1, 1)), Value("two"));
  backend("httppost2").answer = nullptr;
  EXPECT_EQ(send(message(1, 1)), Value("one"));
}

TEST_F(MessageRouting, OtherBackEndsNeverAnswerButAreLogged) {
  configure({"qdx", "ampyx", "uploadserver", "qrs"});
  for (const char* name : {"qdx", "ampyx", "uploadserver", "qrs"}) backend(name).answer = "x";
  EXPECT_TRUE(send(message(1, 1)).isNull());
  EXPECT_EQ(messageLog_.lines(),
            (std::vector<std::string>{
                "[qdx -> sendMessageWithDictionary] x", "[ampyx -> sendMessageWithDictionary] x",
                "[uploadserver -> sendMessageWithDictionary] x", "[qrs -> sendMessageWithDictionary] x"}));
}

TEST_F(MessageRouting, ABackEndThatFiltersLeavesTheAnswer) {
  configure({"httppost", "httppost2"});
  backend("httppost").answer = "one";
  backend("httppost2").answer = "two";
  backend("httppost2").setLists(numbers({}), std::nullopt);
  EXPECT_EQ(send(message(1, 1)), Value("one"));
}

TEST_F(MessageRouting, NeedsNoReply) {
  configure({"httppost"});
  client_.session->sendMessageWithDictionary(message(1, 1), nullptr);
  EXPECT_EQ(sentTo("httppost").size(), 1U);
}

class SingleMessage : public SessionFixture {
 protected:
  std::string sendSingle(Dictionary info, std::optional<Dictionary> user = std::nullopt,
                         std::optional<Dictionary> payload = std::nullopt) {
    std::string answer;
    client_.session->sendMessageWithSessionInfo(std::move(info), std::move(user), 9, 200, std::move(payload),
                                                [&](String text) { answer = text.str(); });
    return answer;
  }
};

TEST_F(SingleMessage, HasOneTimeForAllBackEnds) {
  delegate_.storebag = table({"httppost", "qdx"});
  const TimeValue now = test_.clock.timeOfDay();
  test_.clock.setTick(std::chrono::seconds(1));
  EXPECT_EQ(sendSingle(sessionInfo()), "finished");
  EXPECT_EQ(backend("httppost").sent.at(0).timestamp, now);
  EXPECT_EQ(backend("qdx").sent.at(0).timestamp, now);
}

TEST_F(SingleMessage, NeedsTheIdentifiers) {
  for (const char* key : {"SessionID", "ClientType"}) {
    test_.sink.clear();
    Dictionary info = sessionInfo();
    info.remove(key);
    EXPECT_EQ(sendSingle(info), "Could not retrieve identifiers from sessionInfo");
    EXPECT_TRUE(logged(LogLevel::error,
                       "sendMessageWithSessionInfo: Could not retrieve identifiers from sessionInfo"));
  }
  EXPECT_TRUE(delegate_.calls.empty());
}

TEST_F(SingleMessage, NeedsAStorebag) {
  EXPECT_EQ(sendSingle(sessionInfoAtLevel(2)), "storebag not available");
  EXPECT_EQ(delegate_.calls, (std::vector<std::string>{"correlated 2", "storebag"}));
  EXPECT_EQ(client_.session->sessionID(), 42U);
  EXPECT_TRUE(logged(LogLevel::debug,
                     "sendMessageWithSessionInfo: Sending message with session info for session 42"));
}

TEST_F(SingleMessage, WantsATextAsTheMessageLogDoes) {
  delegate_.storebag = table({"httppost"});
  factory_.prepare = [](RecordingBackend& made) {
    made.answer = "sent";
    made.answersIfWanted = 100;
  };
  EXPECT_EQ(sendSingle(sessionInfo()), "finished");
  messageLog_.setFull(true);
  EXPECT_EQ(sendSingle(sessionInfo()), "finished");
  EXPECT_EQ(messageLog_.asked(), (std::vector<size_t>{100, 100}));
  EXPECT_EQ(messageLog_.lines(), std::vector<std::string>{"[httppost -> sendMessageWithSessionInfo] sent"});
}

TEST_F(SingleMessage, IsSentThroughBackEndsOfItsOwn) {
  delegate_.storebag = table({"httppost", "dashboard"});
  delegate_.sharedData = Dictionary{{"shared", 1}};
  factory_.prepare = [](RecordingBackend& made) { made.answer = "sent"; };
  EXPECT_EQ(sendSingle(sessionInfoAtLevel(0), userInfo(), Dictionary{{"k", "v"}}), "finished");
  EXPECT_TRUE(
      logged(LogLevel::debug, "sendMessageWithSessionInfo: Sending single message with sessionID 42"));
  for (const char* name : {"httppost", "dashboard"}) {
    EXPECT_EQ(backend(name).calls, (std::vector<std::string>{"updateState", "send", "cleanup"}));
    const RecordingBackend::Sent& sent = backend(name).sent.at(0);
    EXPECT_EQ(sent.message, (Dictionary{{"k", "v"}})) << "the bare payload";
    EXPECT_EQ(sent.method, 9);
    EXPECT_EQ(sent.respCode, 200);
    EXPECT_EQ(sent.flag, 0);
    EXPECT_EQ(backend(name).connectivity(), class_.singleMessageHelper());
  }
  EXPECT_EQ(messageLog_.lines(),
            (std::vector<std::string>{"[httppost -> sendMessageWithSessionInfo] sent",
                                      "[dashboard -> sendMessageWithSessionInfo] sent"}));
  EXPECT_EQ(factory_.calls().at(0).userInfo, userInfo());
}

TEST_F(SingleMessage, HasTheSerialNumberOnAnInternalBuild) {
  test_.deviceProperties.setProperty("ReleaseType", "Internal");
  delegate_.storebag = table({"httppost"});
  sendSingle(sessionInfo(), std::nullopt, Dictionary{{"k", "v"}});
  EXPECT_EQ(backend("httppost").sent.at(0).message, (Dictionary{{"k", "v"}, {"SerialNum", "Unknown"}}));
  test_.deviceProperties.setProperty("SerialNumber", "S1");
  sendSingle(sessionInfo());
  EXPECT_EQ(backend("httppost").sent.at(0).message, (Dictionary{{"SerialNum", "S1"}}));
}

TEST_F(SingleMessage, AnEmptyMessageIsSentWithoutAPayload) {
  delegate_.storebag = table({"httppost"});
  EXPECT_EQ(sendSingle(sessionInfo()), "finished");
  EXPECT_TRUE(backend("httppost").sent.at(0).message.empty());
}

TEST_F(SingleMessage, IsFilteredByTheListsAfterTheStateUpdate) {
  delegate_.storebag = table({"httppost", "dashboard", "qdx"});
  factory_.prepare = [](RecordingBackend& made) {
    if (made.name() == "httppost") made.setLists(Array{}, std::nullopt);
    if (made.name() == "dashboard") made.setLists(std::nullopt, Array{9});
  };
  EXPECT_EQ(sendSingle(sessionInfo()), "finished");
  EXPECT_EQ(backend("httppost").calls, (std::vector<std::string>{"updateState", "cleanup"}));
  EXPECT_EQ(backend("dashboard").calls, (std::vector<std::string>{"updateState", "cleanup"}));
  EXPECT_EQ(backend("qdx").sent.size(), 1U);
  EXPECT_TRUE(logged(
      LogLevel::debug,
      "sendMessageWithSessionInfo: Dropping event with category 9 as it is not whitelisted for backend httppost"));
  EXPECT_TRUE(logged(
      LogLevel::debug,
      "sendMessageWithSessionInfo: Dropping event with category 9 as it is blacklisted for backend dashboard"));
}

TEST_F(SingleMessage, LogsAStorebagWithoutBackEndsAndStillFinishes) {
  delegate_.storebag = Dictionary();
  EXPECT_EQ(sendSingle(sessionInfo()), "finished");
  EXPECT_EQ(test_.sink.count(LogLevel::error,
                             "sendMessageWithSessionInfo: No backends available to send single message"),
            1U);
}

TEST_F(SingleMessage, LogsUserInformationThatWasNotPromised) {
  delegate_.storebag = table({"httppost"});
  EXPECT_EQ(sendSingle(sessionInfo(42, false), userInfo()), "finished");
  EXPECT_TRUE(
      logged(LogLevel::error, "sendMessageWithSessionInfo: user info provided without requiring it."));
  EXPECT_EQ(backend("httppost").sent.size(), 1U);
}

TEST_F(SingleMessage, IsNotAggregated) {
  client_.session->setHasAggregator(true);
  delegate_.storebag = table({"httppost"});
  sendSingle(sessionInfo());
  EXPECT_TRUE(client_.connection->messagesToClient().empty());
}

TEST_F(SingleMessage, NewUserInformationReachesAConfiguredSessionsBackEnds) {
  configure({"httppost"});
  const auto configured = factory_.latest("httppost");
  sendSingle(sessionInfo(), userInfo());
  EXPECT_EQ(configured->userInfoDict(), userInfo());
  EXPECT_EQ(configured->updateCount, 2);
}

TEST_F(SingleMessage, TheClassRefusesMissingInformation) {
  class_.sendMessageWithSessionInfo(1000, std::nullopt, std::nullopt, table({"httppost"}), 1, 1,
                                    std::nullopt);
  class_.sendMessageWithSessionInfo(1000, sessionInfo(), std::nullopt, std::nullopt, 1, 1, std::nullopt);
  EXPECT_EQ(test_.sink.count(
                LogLevel::error,
                "RsendMessageWithSessionInfo: Attempted to send message with one or more nil parameters"),
            2U);
  EXPECT_TRUE(factory_.made().empty());
  EXPECT_EQ(test_.counters.value(Reason::identifiersMissing), 1U);
  EXPECT_EQ(test_.counters.value(Reason::noStorebag), 1U);
}

TEST_F(SingleMessage, ConcurrentFirstOnesShareOneHelper) {
  const size_t before = test_.urlSessions.sessionsCreated();
  std::vector<std::shared_ptr<ReportingSessionConnectivityHelper>> helpers(4);
  {
    std::vector<std::jthread> threads;
    for (auto& helper : helpers) threads.emplace_back([&] { helper = class_.singleMessageHelper(); });
  }
  for (const auto& helper : helpers) EXPECT_EQ(helper, helpers[0]);
  EXPECT_EQ(test_.urlSessions.sessionsCreated(), before + 1);
}

class DroppedMessages : public MessageRouting {
 protected:
  uint64_t count(Reason reason) const { return test_.counters.value(reason); }
  void sendSingle(const Dictionary& info) {
    client_.session->sendMessageWithSessionInfo(info, std::nullopt, 4, 1, std::nullopt, nullptr);
  }
};

TEST_F(DroppedMessages, CountByWhatTheirSessionLacks) {
  send(message(1, 2));
  send(message(1, 2));
  EXPECT_EQ(count(Reason::notConfigured), 2U);
  client_.session->setSessionInfo(sessionInfo(), std::nullopt, nullptr, false);
  client_.session->startConfigWithCompletionHandler(nullptr);
  send(message(1, 2));
  EXPECT_EQ(count(Reason::noStorebag), 1U);
  configure({});
  send(message(1, 2));
  EXPECT_EQ(count(Reason::noBackEnds), 2U) << "the start message is one";
  configure({"httppost"});
  send(message(1, 2));
  EXPECT_EQ(count(Reason::notConfigured), 2U);
  EXPECT_EQ(count(Reason::noStorebag), 1U);
  EXPECT_EQ(count(Reason::noBackEnds), 2U);
}

TEST_F(DroppedMessages, CountForMissingNumbers) {
  configure({"httppost"});
  send(Dictionary());
  send(Dictionary{{"Category", 1}});
  EXPECT_EQ(count(Reason::categoryOrTypeMissing), 2U);
}

TEST_F(DroppedMessages, AreToldOnceForEachReasonAtTheDefaultLevel) {
  test_.log.setLevel(LogLevel::normal);
  const auto told = [this](const std::string& why) {
    size_t lines = 0;
    for (const auto& line : test_.sink.lines())
      if (line.line.find(why) != std::string::npos) ++lines;
    return lines;
  };
  for (int i = 0; i < 3; ++i) send(message(1, 2));
  EXPECT_EQ(told("are dropped: it was not configured"), 1U);
  configure({"httppost"});
  for (int i = 0; i < 3; ++i) send(Dictionary{{"Category", 1}});
  EXPECT_EQ(told("are dropped: they have no \"Category\" or no \"Type\""), 1U);
}

TEST_F(DroppedMessages, WithoutACategoryAreToldToo) {
  configure({"httppost"});
  send(Dictionary{{"Type", 1}});
  EXPECT_EQ(test_.sink.count("are dropped: they have no \"Category\" or no \"Type\""), 1U);
}

// One of the two is enough to be told.
TEST_F(DroppedMessages, AnOddCategoryAloneIsTold) {
  configure({"httppost"});
  send(Dictionary{{"Category", -1}, {"Type", 2}});
  EXPECT_TRUE(test_.sink.contains(LogLevel::normal, "-1 and 2 are read as 65535 and 2"));
}

TEST_F(DroppedMessages, AnOddTypeAloneIsTold) {
  configure({"httppost"});
  send(Dictionary{{"Category", 1}, {"Type", 65536U}});
  EXPECT_TRUE(test_.sink.contains(LogLevel::normal, "1 and 65536 are read as 1 and 0"));
}

// They are taken all the same.
TEST_F(DroppedMessages, NumbersThatAreCutOrNoneAreTold) {
  configure({"httppost"});
  send(Dictionary{{"Category", "three"}, {"Type", 70000}});
  EXPECT_TRUE(
      test_.sink.contains(LogLevel::normal,
                          "sends a Category or Type that is no number up to 65535: three and 70000 are "
                          "read as 0 and 4464"));
}

TEST_F(DroppedMessages, CountForEachBackEndWhoseListsRefuseThem) {
  configure({"httppost", "httppost2", "dashboard"});
  backend("httppost").setLists(numbers({5}), std::nullopt);
  backend("httppost2").setLists(std::nullopt, numbers({4}));
  send(message(4, 1));
  EXPECT_EQ(count(Reason::eventFiltered), 2U);
  send(message(5, 1));
  EXPECT_EQ(count(Reason::eventFiltered), 2U);
}

TEST_F(DroppedMessages, CountAtTheOtherDoorToo) {
  sendSingle(Dictionary{{"ClientType", 7}});
  EXPECT_EQ(count(Reason::identifiersMissing), 1U);
  sendSingle(sessionInfo());
  EXPECT_EQ(count(Reason::noStorebag), 1U);
  delegate_.storebag = Dictionary();
  sendSingle(sessionInfo());
  EXPECT_EQ(count(Reason::noBackEnds), 1U);
  delegate_.storebag = table({"httppost", "httppost2"});
  factory_.prepare = [](RecordingBackend& made) {
    if (made.name() == "httppost") made.setLists(numbers({5}), std::nullopt);
    if (made.name() == "httppost2") made.setLists(std::nullopt, numbers({4}));
  };
  sendSingle(sessionInfo());
  EXPECT_EQ(count(Reason::eventFiltered), 2U);
}

}  // namespace
}  // namespace kyt
