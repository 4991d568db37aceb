// What a session keeps for a daemon that comes back.
#include "client/KeptState.h"

#include <gtest/gtest.h>

namespace kyt::client {
namespace {

KeptState kept(bool promisesUserInfo = false, std::optional<Dictionary> userInfo = std::nullopt) {
  return KeptState(
      {{{kKYTReportingSessionInfoClientType, 7}, {kKYTReportingSessionInfoRequireUserInfo, promisesUserInfo}},
       std::move(userInfo),
       {},
       false});
}

TEST(KeptState, IsConfiguredOnceTheCallWasSent) {
  KeptState state = kept();
  EXPECT_FALSE(state.isConfigured());
  state.takeOver({Method::fetchDisplayURL});
  EXPECT_FALSE(state.isConfigured());
  state.takeOver({Method::startConfigWithCompletionHandler});
  EXPECT_TRUE(state.isConfigured());
}

TEST(KeptState, KeepsTheLastUserInformation) {
  KeptState state = kept(true, Dictionary{{"ClientName", "first"}});
  EXPECT_EQ(state.identity().userInfo, (Dictionary{{"ClientName", "first"}}));
  state.takeOver({Method::fetchStatesWithUserInfo, UserInfoArguments{Dictionary{{"ClientName", "second"}}}});
  EXPECT_EQ(state.identity().userInfo, (Dictionary{{"ClientName", "second"}}));
}

TEST(KeptState, ForgetsUserInformationThatIsTakenBackUnlessItWasPromised) {
  for (const bool promised : {false, true}) {
    KeptState state = kept(promised, Dictionary{{"ClientName", "n"}});
    state.takeOver({Method::fetchStatesWithUserInfo, UserInfoArguments{}});
    EXPECT_EQ(state.identity().userInfo.has_value(), promised);
  }
}

TEST(KeptState, AddsUpSharedData) {
  KeptState state = kept();
  state.takeOver({Method::updateSharedDataWithDictionary, SharedDataArguments{{{"a", 1}, {"b", 2}}}});
  state.takeOver({Method::updateSharedDataWithDictionary, SharedDataArguments{{{"b", 3}, {"a", Value()}}}});
  state.takeOver({Method::updateSharedDataForKey, SharedDataForKeyArguments{"c", 4}});
  EXPECT_EQ(state.sharedData(), (Dictionary{{"a", 1}, {"b", 3}, {"c", 4}}));
  state.takeOver({Method::updateSharedDataForKey, SharedDataForKeyArguments{"b", Value()}});
  EXPECT_EQ(state.sharedData(), (Dictionary{{"a", 1}, {"c", 4}}));
}

TEST(KeptState, KeepsTheLastDigestKey) {
  KeptState state = kept();
  EXPECT_FALSE(state.digestKey());
  state.takeOver({Method::setDigestKey, DigestKeyArguments{Data("one"), 1}});
  state.takeOver({Method::setDigestKey, DigestKeyArguments{Data("two"), 2}});
  ASSERT_TRUE(state.digestKey());
  EXPECT_EQ(state.digestKey()->key, Data("two"));
  EXPECT_EQ(state.digestKey()->algorithm, 2);
}

TEST(KeptState, KeepsNothingOfAMessage) {
  KeptState state = kept();
  state.takeOver({Method::sendMessageWithDictionary, MessageArguments{1, 2, 0, {{"a", 1}}}});
  state.takeOver({Method::sendMessageWithSessionInfo,
                  SingleMessageArguments{{}, Dictionary{{"ClientName", "n"}}, 1, 2, Dictionary{{"a", 1}}}});
  EXPECT_FALSE(state.isConfigured());
  EXPECT_EQ(state.identity().userInfo, std::nullopt);
  EXPECT_TRUE(state.sharedData().empty());
}

TEST(KeptState, SaysWhyNoBackEndIsLive) {
  EXPECT_NE(KeptState({}).whyNoStorebag().find("has no ClientType"), std::string::npos);
  EXPECT_NE(KeptState({{{kKYTReportingSessionInfoClientType, 4}}, {}, {}, false})
                .whyNoStorebag()
                .find("type 4 has no"),
            std::string::npos);
  EXPECT_NE(kept().whyNoStorebag().find("no storebag for client type 7"), std::string::npos);
  EXPECT_NE(kept(true).whyNotLive().find("has no user information"), std::string::npos);
  EXPECT_NE(kept(true, Dictionary{{"ClientName", "n"}}).whyNotLive().find("consent"), std::string::npos);
  EXPECT_NE(
      kept(false, Dictionary{{"ClientName", "n"}}).whyNotLive().find("ClientName \"n\", ServiceName none"),
      std::string::npos);
}

}  // namespace
}  // namespace kyt::client
