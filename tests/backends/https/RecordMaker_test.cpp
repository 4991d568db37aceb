// Records by themselves, without a back end.
#include "backends/https/RecordMaker.h"

#include <gtest/gtest.h>

#include <vector>

#include "platform/objects/Keys.h"
#include "tests/support/TestPlatform.h"

namespace kyt {
namespace {

class RecordMakerTest : public testing::Test {
 protected:
  RecordMakerTest() {
    facts_.sessionID = 77;
    facts_.compType = 6;
    facts_.clientVersion = 3;
    facts_.setSelfVersion("8.1.2");
    facts_.setStartTimestamp({1000000123, 900000});
  }
  RecordMaker maker() { return {platform_.configuration, std::make_shared<SessionFacts>(facts_)}; }
  Dictionary record(Dictionary payload = {}, const std::optional<String>& sessionID = String("12.77")) {
    return maker().record(std::move(payload), {{1000000129, 400000}, 5, 2, 9}, sessionID, 0);
  }

  TestPlatform platform_;
  SessionFacts facts_;
};

TEST_F(RecordMakerTest, TheFixedKeysFollowThePayloadInTheirOrder) {
  facts_.hardwareType = String("Phone9,1");
  facts_.productFamily = String("Phone");
  facts_.productVersion = String("17.1");
  facts_.buildVersion = String("21B74");
  std::vector<std::string> keys;
  for (const DictionaryEntry& entry : record({{"k", 1}})) keys.push_back(entry.key.str());
  EXPECT_EQ(keys, (std::vector<std::string>{"k", "_startTS", "_sender", "_clientVersion", "_sessionID",
                                            "_eventNumber", "_method", "_status", "_clientTS", "eventTime",
                                            "_productFamily", "_productModel", "_osVersion", "_build",
                                            "_internal", "_reportVers", "_timezoneOffset"}));
}

TEST_F(RecordMakerTest, KnowsTheKeysThatItSetsFromOthers) {
  facts_.hardwareType = facts_.productFamily = facts_.productVersion = facts_.buildVersion = String("known");
  for (const DictionaryEntry& entry : record()) EXPECT_TRUE(isRecordKey(entry.key.view())) << entry.key.str();
  for (const char* other : {"", "_", "_mine", "method", "eventtime", "_METHOD", "ClientName"})
    EXPECT_FALSE(isRecordKey(other)) << other;
}

TEST_F(RecordMakerTest, SaysWhatItIsTold) {
  const Dictionary made = record();
  EXPECT_EQ(*made.find("_startTS"), Value(1000000080));
  EXPECT_NEAR(made.find("_clientTS")->doubleValue(), 1000000085.5, 1e-6);
  EXPECT_EQ(*made.find("_sender"), Value("QG"));
  EXPECT_EQ(*made.find("_eventNumber"), Value(9));
  EXPECT_EQ(*made.find("_method"), Value(5));
  EXPECT_EQ(*made.find("_status"), Value(2));
  EXPECT_EQ(*made.find("_sessionID"), Value("12.77"));
  EXPECT_EQ(*made.find("_reportVers"), Value("8.1.2"));
  EXPECT_FALSE(made.contains("_productModel"));
  EXPECT_FALSE(record({}, std::nullopt).contains("_sessionID"));
}

TEST_F(RecordMakerTest, ReplacesAKeyOfThePayloadWhereItStands) {
  const Dictionary made = record({{"_method", "mine"}, {"k", 1}});
  EXPECT_EQ(made.begin()->key, "_method");
  EXPECT_EQ(*made.find("_method"), Value(5));
}

TEST_F(RecordMakerTest, TheNumberOfASessionStandsForItsIdentifierWhereTheClientsTypeSaysSo) {
  facts_.compType = 7;
  EXPECT_EQ(*record().find("_sessionID"), Value(77u));
  EXPECT_EQ(*record({}, std::nullopt).find("_sessionID"), Value(77u));
}

TEST_F(RecordMakerTest, APayloadStandsUnderItsKeyOrIsTheWholeMessage) {
  Dictionary envelope{{kKYTReportingMessageBlobClientData, Dictionary{{"k", 1}}},
                      {kKYTReportingMessageBlobSharedData, Dictionary{{"s", 2}}}};
  EXPECT_EQ(maker().takePayload(envelope), (Dictionary{{"k", 1}}));
  EXPECT_TRUE(envelope.contains(kKYTReportingMessageBlobSharedData));
  Dictionary bare{{"k", 1}};
  EXPECT_EQ(maker().takePayload(bare), (Dictionary{{"k", 1}}));
  Dictionary wrong{{kKYTReportingMessageBlobClientData, 7}};
  EXPECT_TRUE(maker().takePayload(wrong).empty());
  EXPECT_TRUE(platform_.sink.contains(
      LogLevel::error, "HTTPSPostBackend(sendMessage): SESSION_TYPE_STOP message dictionary is nil"));
}

}  // namespace
}  // namespace kyt
