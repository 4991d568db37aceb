// What the storebag's entries decide, by itself, without a back end.
#include "backends/https/ClientRules.h"

#include <gtest/gtest.h>

#include "backend/KYTReportingBackend.h"
#include "platform/objects/Keys.h"
#include "tests/support/TestPlatform.h"

namespace kyt {
namespace {

class ClientRulesTest : public testing::Test {
 protected:
  ClientRulesTest() {
    platform_.deviceProperties.setCountryCode("US");
    session_.requireUserInfo = true;
  }
  int32_t decide(const Array& clients) {
    ClientRules rules(platform_.platform,
                      {"httppost", clients, std::make_shared<SessionFacts>(session_), draw_, consent_});
    return rules.decide(decision_, &userInfo_, std::nullopt);
  }
  int32_t decide() { return decide(Array{entry_}); }

  TestPlatform platform_;
  SessionFacts session_;
  double draw_ = 0.5;
  bool consent_ = true;
  Dictionary userInfo_{{kKYTReportingUserInfoClientName, "a"}, {kKYTReportingUserInfoServiceName, "b"}};
  Dictionary entry_{{"client", "a"},
                    {"locale_whitelist", Array{"US"}},
                    {"filters", Array{Dictionary{{"key", "secret"}, {"action", "remove"}}}},
                    {"sampling_threshold", 0.5},
                    {"event_threshold", 7},
                    {"post_url", "https://post.example.org/"}};
  Decision decision_;
};

TEST_F(ClientRulesTest, AnEntryThatFitsEnablesAndSaysTheRest) {
  entry_.merge({{"use_wifi_only", 1},
                {"expedite", 0},
                {"event_whitelist", Array{1}},
                {"event_blacklist", Array{2}},
                {"extras_on_internal", 3}});
  EXPECT_EQ(decide(), kBackendStateEnabled);
  EXPECT_EQ(decision_.postURL, String("https://post.example.org/"));
  EXPECT_EQ(decision_.realtimePostURL, decision_.postURL);
  EXPECT_EQ(decision_.eventThreshold, 7);
  EXPECT_EQ(decision_.extrasOnInternal, 3);
  EXPECT_EQ(decision_.filters.numberOfFilters(), 1);
  EXPECT_EQ(decision_.samplingThreshold, Value(0.5));
  EXPECT_EQ(decision_.batchEvents, true);
  EXPECT_EQ(decision_.eventWhitelist, Array{1});
  EXPECT_EQ(decision_.eventBlacklist, Array{2});
  EXPECT_TRUE(decision_.shouldUseWiFiOnly);
  EXPECT_EQ(decision_.dnuType, 0);
}

TEST_F(ClientRulesTest, BeforeTheFirstDecisionABatchTakesFifty) {
  EXPECT_EQ(decision_.eventThreshold, 49);
  EXPECT_FALSE(decision_.postURL);
}

TEST_F(ClientRulesTest, WithoutConsentOrCountryOrFiltersOrEntryNothingIsPosted) {
  consent_ = false;
  EXPECT_EQ(decide(), kBackendStateDisabled);
  consent_ = true;
  EXPECT_EQ(decide(Array{}), kBackendStateDisabled);
  platform_.deviceProperties.setCountryCode("DE");
  EXPECT_EQ(decide(), kBackendStateDisabled);
  platform_.deviceProperties.setCountryCode("US");
  entry_.set("filters", 5);
  EXPECT_EQ(decide(), kBackendStateDisabled);
  EXPECT_FALSE(decision_.postURL) << "an entry that may not report gives no address";
}

TEST_F(ClientRulesTest, AnOverrideOfTheConsentSaysWhetherThereIsOne) {
  entry_.set("override_dnu", 1);
  EXPECT_EQ(decide(), kBackendStateEnabled);
  EXPECT_EQ(decision_.dnuType, 2);
  consent_ = false;
  EXPECT_EQ(decide(), kBackendStateEnabled);
  EXPECT_EQ(decision_.dnuType, 1);
}

TEST_F(ClientRulesTest, TheDrawDecidesBetweenEnabledHeldAndDisabled) {
  EXPECT_EQ(decide(), kBackendStateEnabled);
  draw_ = 0.51;
  EXPECT_EQ(decide(), kBackendStateHeld);
  entry_.set("override_sampling", 0.5);
  EXPECT_EQ(decide(), kBackendStateDisabled);
  EXPECT_EQ(decision_.overrideSampling, Value(0.5));
}

TEST_F(ClientRulesTest, UserInformationThatIsPromisedIsWaitedFor) {
  userInfo_ = {};
  EXPECT_EQ(decide(), kBackendStateUndecided);
  session_.requireUserInfo = false;
  EXPECT_EQ(decide(), kBackendStateEnabled);
}

TEST_F(ClientRulesTest, WhatTheLatestDecisionDoesNotSayIsMissing) {
  entry_.set("expedite", 1);
  entry_.set("event_whitelist", Array{1});
  EXPECT_EQ(decide(), kBackendStateEnabled);
  EXPECT_EQ(decision_.batchEvents, false);
  consent_ = false;
  entry_ = {{"client", "a"}};
  EXPECT_EQ(decide(), kBackendStateDisabled);
  EXPECT_FALSE(decision_.batchEvents);
  EXPECT_FALSE(decision_.samplingThreshold);
  EXPECT_FALSE(decision_.eventWhitelist);
  EXPECT_EQ(decision_.postURL, String("https://post.example.org/")) << "addresses stay";
  EXPECT_EQ(decision_.filters.numberOfFilters(), 1) << "and so do filters";
}

TEST_F(ClientRulesTest, TheDevicesOwnAddressIsNotReplaced) {
  decision_.postURL = String("https://mine.example.org/");
  decision_.useDefaultPostURL = true;
  EXPECT_EQ(decide(), kBackendStateEnabled);
  EXPECT_EQ(decision_.postURL, String("https://mine.example.org/"));
}

TEST_F(ClientRulesTest, ACustomIdentifierIsMadeOnceForEachClientAndKept) {
  entry_.set("custom_clientId", 1);
  EXPECT_EQ(decide(), kBackendStateEnabled);
  const std::optional<String> first = decision_.uuidCustom;
  ASSERT_TRUE(first);
  EXPECT_EQ(platform_.userDefaults.value(kKYTReportingDefaultsDomain, "uuid:a:b"), Value(*first));
  EXPECT_EQ(decide(), kBackendStateEnabled);
  EXPECT_EQ(decision_.uuidCustom, first);
}

}  // namespace
}  // namespace kyt
