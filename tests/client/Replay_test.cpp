// What a daemon that comes back is told again.
#include <gtest/gtest.h>

#include <algorithm>
#include <future>

#include "client/Replay.h"
#include "kytreporting/KYTReporting.h"
#include "tests/client/AnswerOf.h"
#include "tests/client/TestDaemon.h"
#include "tests/support/Eventually.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt {
namespace {

const std::string kMegabyte(1024 * 1024, 'x');

class ClientReplay : public testing::Test {
 protected:
  KYTReporting::Options options() const {
    KYTReporting::Options made;
    made.socketPath = socket_;
    made.sessionInfo = {{kKYTReportingSessionInfoSessionID, 42}, {kKYTReportingSessionInfoClientType, 7}};
    made.maxQueuedBytes = 64u << 20;
    return made;
  }
  // What the daemon is told when it comes back, up to a call made then.
  std::vector<std::string> toldAgain(KYTReporting& session) {
    daemon_.stop();
    const size_t before = daemon_.calls().size();
    EXPECT_TRUE(daemon_.start());
    std::promise<void> flushed;
    EXPECT_TRUE(eventually([&] { return session.statistics().connections == 2; }));
    session.flush([&](const Value&, const auto&) { flushed.set_value(); });
    answerOf(flushed);
    const std::vector<std::string> all = daemon_.calls();
    return {all.begin() + static_cast<long>(before), all.end()};
  }
  static bool allTaken(KYTReporting& session) {
    std::promise<void> flushed;
    session.flush([&](const Value&, const auto&) { flushed.set_value(); });
    answerOf(flushed);
    return true;
  }

  TemporaryFolder folder_;
  const std::string socket_ = folder_ / "socket";
  TestDaemon daemon_{socket_};
};

// What is told of a state, by a sender that refuses calls of these methods.
struct Told {
  std::vector<std::string> calls;
  client::Replayed result;
};
Told told(const client::KeptState& kept, const std::vector<wire::Method>& refused = {},
          bool alsoAlone = false) {
  Told all;
  all.result = client::replay(kept, [&](client::Call call) {
    const auto* identity = std::get_if<client::IdentityArguments>(&call.arguments);
    const bool alone = identity != nullptr && !identity->userInfo;
    if (std::find(refused.begin(), refused.end(), call.method) != refused.end() && (!alone || alsoAlone))
      return false;
    all.calls.emplace_back(wire::contractOf(call.method).member);
    return true;
  });
  return all;
}

client::KeptState everythingKept() {
  client::KeptState kept({{}, Dictionary{{"ClientName", "n"}}, {}, false});
  kept.takeOver({wire::Method::startConfigWithCompletionHandler});
  kept.takeOver(
      {wire::Method::updateSharedDataWithDictionary, client::SharedDataArguments{{{"a", 1}, {"b", 2}}}});
  kept.takeOver({wire::Method::setDigestKey, client::DigestKeyArguments{Data("key"), 1}});
  return kept;
}

TEST(Replay, TellsWhoTheSessionIsFirstAndThenWhatItSaid) {
  const Told all = told(everythingKept());
  EXPECT_EQ(all.calls, (std::vector<std::string>{"SetSessionInfo", "StartConfigWithCompletionHandler",
                                                 "UpdateSharedDataWithDictionary", "SetDigestKey"}));
  EXPECT_TRUE(all.result.identified);
  EXPECT_EQ(all.result.failed, 0U);
}

TEST(Replay, TellsOfANewSessionOnlyWhoItIs) {
  EXPECT_EQ(told(client::KeptState({})).calls, std::vector<std::string>{"SetSessionInfo"});
}

TEST(Replay, TellsInSmallerPiecesWhatCannotBeSentAtOnce) {
  const Told all =
      told(everythingKept(), {wire::Method::setSessionInfo, wire::Method::updateSharedDataWithDictionary});
  EXPECT_EQ(all.calls, (std::vector<std::string>{"SetSessionInfo", "FetchStatesWithUserInfo",
                                                 "StartConfigWithCompletionHandler", "UpdateSharedDataForKey",
                                                 "UpdateSharedDataForKey", "SetDigestKey"}));
  EXPECT_EQ(all.result.failed, 0U);
}

TEST(Replay, CountsEachValueThatCannotBeSent) {
  const Told all =
      told(everythingKept(), {wire::Method::setSessionInfo, wire::Method::fetchStatesWithUserInfo,
                              wire::Method::updateSharedDataWithDictionary,
                              wire::Method::updateSharedDataForKey, wire::Method::setDigestKey});
  EXPECT_TRUE(all.result.identified);
  EXPECT_EQ(all.result.failed, 4U);
}

TEST(Replay, TellsNothingWhenItCannotSayWhoTheSessionIs) {
  const Told all = told(everythingKept(), {wire::Method::setSessionInfo}, true);
  EXPECT_FALSE(all.result.identified);
  EXPECT_EQ(all.calls, std::vector<std::string>());
}

TEST_F(ClientReplay, SendsSharedDataOfMoreThanOneMessageInPieces) {
  ASSERT_TRUE(daemon_.start());
  const auto session = KYTReporting::open(options());
  for (int i = 0; i < 30; ++i)
    session->updateSharedData("key" + std::to_string(i), std::string_view(kMegabyte).substr(0, 100000));
  ASSERT_TRUE(allTaken(*session));
  const std::vector<std::string> again = toldAgain(*session);
  int entries = 0, calls = 0;
  for (const std::string& call : again)
    if (call.starts_with("SharedData ")) {
      entries += std::stoi(call.substr(11));
      ++calls;
    }
  EXPECT_EQ(entries, 30);
  EXPECT_GT(calls, 2);
  EXPECT_EQ(session->statistics().replayFailed, 0U);
}

TEST_F(ClientReplay, SendsAValueThatJustFittedItsOwnCall) {
  ASSERT_TRUE(daemon_.start());
  const auto session = KYTReporting::open(options());
  // The largest that is taken, found from above.
  size_t size = kMegabyte.size();
  uint64_t refused = 0;
  do {
    size -= 8;
    session->updateSharedData("large", std::string_view(kMegabyte).substr(0, size));
    ASSERT_TRUE(allTaken(*session));
  } while (std::exchange(refused, session->statistics().droppedInvalid) !=
           session->statistics().droppedInvalid);
  session->updateSharedData("small", 1);
  ASSERT_TRUE(allTaken(*session));
  size_t large = 0, small = 0;
  for (const std::string& call : toldAgain(*session)) {
    if (call.starts_with("SharedData large=") && call.size() > size) ++large;
    if (call == "SharedData 1") ++small;
  }
  EXPECT_EQ(large + small, 2U);
  EXPECT_EQ(session->statistics().replayFailed, 0U);
}

TEST_F(ClientReplay, KeepsNothingOfAnUpdateThatCouldNotBeSent) {
  ASSERT_TRUE(daemon_.start());
  const auto session = KYTReporting::open(options());
  session->updateSharedData({{"x", 1}});
  session->updateSharedData({{"y", 2}, {"huge", std::string_view(kMegabyte)}});
  session->updateSharedData("huge", std::string_view(kMegabyte));
  session->updateSharedData({{"x", Value()}});  // a null is left out on the way: the daemon keeps the 1
  session->setDigestKey(Data("key"), 3);
  session->setDigestKey(Data(std::string_view(kMegabyte)), 4);
  std::promise<std::optional<Error>> fetched;
  session->fetchStates(Dictionary{{"ClientName", std::string_view(kMegabyte)}},
                       [&](auto, std::optional<Error> error) { fetched.set_value(std::move(error)); });
  const auto error = answerOf(fetched);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, static_cast<int32_t>(ClientError::invalid));
  EXPECT_EQ(session->statistics().droppedInvalid, 4U);
  EXPECT_EQ(toldAgain(*session),
            (std::vector<std::string>{"SetSessionInfo 42", "SharedData 1", "DigestKey key 3", "Flush"}));
  EXPECT_EQ(session->statistics().replayFailed, 0U);
}

TEST_F(ClientReplay, SendsUserInformationByItselfWhenItDoesNotFitBesideTheRest) {
  ASSERT_TRUE(daemon_.start());
  KYTReporting::Options large = options();
  large.frameworksToCheck = std::string_view(kMegabyte).substr(0, 600000);
  const auto session = KYTReporting::open(std::move(large));
  session->startConfiguration();
  std::promise<std::optional<Error>> fetched;
  session->fetchStates(
      Dictionary{{"ClientName", "n"}, {"more", std::string_view(kMegabyte).substr(0, 600000)}},
      [&](auto, std::optional<Error> error) { fetched.set_value(std::move(error)); });
  EXPECT_FALSE(answerOf(fetched));
  EXPECT_EQ(toldAgain(*session),
            (std::vector<std::string>{"SetSessionInfo 42", "FetchStates n", "StartConfig", "Flush"}));
}

// As the daemon takes it: what was promised stays, what was not is gone.
TEST_F(ClientReplay, SendsNoUserInformationThatTheProgramTookBack) {
  ASSERT_TRUE(daemon_.start());
  for (const bool promised : {false, true}) {
    KYTReporting::Options with = options();
    with.sessionInfo = SessionInfo{.sessionID = 42, .clientType = 7, .requireUserInfo = promised};
    with.userInfo = Dictionary{{"ClientName", "n"}};
    const auto session = KYTReporting::open(std::move(with));
    session->fetchStates(std::nullopt);
    ASSERT_TRUE(allTaken(*session));
    EXPECT_EQ(toldAgain(*session),
              (std::vector<std::string>{promised ? "SetSessionInfo 42 user" : "SetSessionInfo 42", "Flush"}));
  }
}

TEST_F(ClientReplay, SendsNothingForASessionThatCannotSayWhoItIs) {
  ASSERT_TRUE(daemon_.start());
  KYTReporting::Options huge = options();
  huge.frameworksToCheck = std::string_view(kMegabyte);
  const auto session = KYTReporting::open(std::move(huge));
  EXPECT_TRUE(eventually([&] { return session->state() == KYTReporting::State::refused; }));
  EXPECT_NE(session->stateReason().find("cannot be sent"), std::string::npos);
  EXPECT_TRUE(eventually([&] { return !session->sendMessage(1, 1, {}); }));
  EXPECT_EQ(daemon_.calls(), std::vector<std::string>());
}

TEST_F(ClientReplay, CountsWhatTheDaemonThatCameBackRefuses) {
  ASSERT_TRUE(daemon_.start());
  const auto session = KYTReporting::open(options());
  session->startConfiguration();
  ASSERT_TRUE(allTaken(*session));
  daemon_.setAnswersConfigurations(false);
  EXPECT_EQ(toldAgain(*session), (std::vector<std::string>{"SetSessionInfo 42", "StartConfig", "Flush"}));
  EXPECT_EQ(session->statistics().replayFailed, 1U);
  session->startConfiguration();
  ASSERT_TRUE(allTaken(*session));
  EXPECT_EQ(session->statistics().replayFailed, 1U) << "only what is said again";
}

TEST_F(ClientReplay, CountsUserInformationThatCanNeverBeSent) {
  ASSERT_TRUE(daemon_.start());
  KYTReporting::Options huge = options();
  huge.userInfo = Dictionary{{"ClientName", std::string_view(kMegabyte)}};
  const auto session = KYTReporting::open(std::move(huge));
  EXPECT_TRUE(session->finish());
  EXPECT_EQ(session->statistics().replayFailed, 1U);
  EXPECT_EQ(daemon_.calls(), (std::vector<std::string>{"SetSessionInfo 42", "Finish"}));
}

}  // namespace
}  // namespace kyt
