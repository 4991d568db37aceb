// The record of one event.
#include <cmath>

#include "tests/backends/https/HTTPSFixture.h"

namespace kyt {
namespace {

class HTTPSPostBackendRecord : public HTTPSFixture {
 protected:
  Dictionary record(const Dictionary& payload = {}, TimeValue timestamp = {1000000025, 500000}) {
    return backend().newEventDictfromPayload(payload, timestamp, 5, 2, EventID{99});
  }
  static Value entryOf(const Dictionary& dictionary, const char* key) {
    const Value* value = dictionary.find(key);
    return value != nullptr ? *value : Value();
  }
  Value sessionIDFor(int32_t clientType, bool internal) {
    facts_.compType = clientType;
    facts_.isInternal = internal;
    backend_.reset();
    backend().setCombinedSessionIDString(String("12.77"));
    return entryOf(record(), "_sessionID");
  }
};

TEST_F(HTTPSPostBackendRecord, HasTheOffsetOfTheTimeAtWhichItIsMade) {
  const int64_t now = platform_.clock.timeOfDay().seconds;
  platform_.deviceProperties.setSecondsFromGMT(3600);
  platform_.deviceProperties.changeSecondsFromGMT(now, 7200);
  EXPECT_EQ(entryOf(record({}, {now - 1, 0}), "_timezoneOffset"), Value(7200));
}

TEST_F(HTTPSPostBackendRecord, HoldsThePayloadAndTheFixedKeysInOrder) {
  platform_.deviceProperties.setSecondsFromGMT(-3600);
  backend().setCombinedSessionIDString(String("12.77"));
  std::vector<std::string> keys;
  const Dictionary made = record({{"b", 1}, {"a", 2}});
  for (const DictionaryEntry& entry : made) keys.push_back(entry.key.str());
  EXPECT_EQ(keys, (std::vector<std::string>{"b", "a", "_startTS", "_sender", "_clientVersion", "_sessionID",
                                            "_eventNumber", "_method", "_status", "_clientTS", "eventTime",
                                            "_productFamily", "_productModel", "_osVersion", "_build",
                                            "_internal", "_reportVers", "_timezoneOffset"}));
  EXPECT_EQ(made, (Dictionary{{"b", 1},
                              {"a", 2},
                              {"_startTS", 1000000020},
                              {"_sender", "QG"},
                              {"_clientVersion", 3u},
                              {"_sessionID", "12.77"},
                              {"_eventNumber", 0u},
                              {"_method", 5u},
                              {"_status", 2u},
                              {"_clientTS", 1000000025.5},
                              {"eventTime", 1000000025.5},
                              {"_productFamily", "Phone"},
                              {"_productModel", "Phone9,1"},
                              {"_osVersion", "17.1"},
                              {"_build", "21B74"},
                              {"_internal", 0u},
                              {"_reportVers", "8.0"},
                              {"_timezoneOffset", -3600}}));
}

TEST_F(HTTPSPostBackendRecord, CutsTheStartToItsMinuteAndAddsTheOffsetToThat) {
  facts_.setStartTimestamp({1000000123, 900000});
  const Dictionary made = record({}, {1000000129, 400000});
  EXPECT_EQ(entryOf(made, "_startTS"), Value(1000000080));
  EXPECT_NEAR(entryOf(made, "_clientTS").doubleValue(), 1000000085.5, 1e-6);
  EXPECT_EQ(entryOf(made, "eventTime"), entryOf(made, "_clientTS"));
}

TEST_F(HTTPSPostBackendRecord, CutsANegativeStartTowardsZero) {
  facts_.setStartTimestamp({-90, 0});
  EXPECT_EQ(entryOf(record({}, {-90, 0}), "_startTS"), Value(-60));
}

TEST_F(HTTPSPostBackendRecord, ShowsTheMinorVersionOnlyWhenThereIsOne) {
  facts_.setSelfVersion("3.1");
  EXPECT_EQ(entryOf(record(), "_reportVers"), Value("3.1"));
  facts_.setSelfVersion("3.1.2");
  backend_.reset();
  EXPECT_EQ(entryOf(record(), "_reportVers"), Value("3.1.2"));
}

TEST_F(HTTPSPostBackendRecord, WithoutACombinedSessionIDHasNone) {
  EXPECT_FALSE(record().contains("_sessionID"));
}

TEST_F(HTTPSPostBackendRecord, SomeClientTypesSendTheNumberOfTheirSession) {
  EXPECT_EQ(sessionIDFor(7, false), Value(77u));
  EXPECT_EQ(sessionIDFor(11, false), Value("12.77"));
  EXPECT_EQ(sessionIDFor(11, true), Value(77u));
  EXPECT_EQ(sessionIDFor(13, false), Value("12.77"));
  EXPECT_EQ(sessionIDFor(13, true), Value(77u));
  EXPECT_EQ(sessionIDFor(12, true), Value("12.77"));
}

TEST_F(HTTPSPostBackendRecord, FixedKeysReplaceThoseOfThePayload) {
  const Dictionary made = record({{"_sender", "me"}, {"eventTime", "now"}, {"_osVersion", "0"}});
  EXPECT_EQ(entryOf(made, "_sender"), Value("QG"));
  EXPECT_EQ(entryOf(made, "eventTime"), Value(1000000025.5));
  EXPECT_EQ(entryOf(made, "_osVersion"), Value("17.1"));
  EXPECT_EQ(made.begin()->key, "_sender");
  EXPECT_EQ(made.size(), 15u);
}

TEST_F(HTTPSPostBackendRecord, TheOneFixedKeyWithoutUnderscoreReplacesThePayloadsToo) {
  const Dictionary made = record({{"eventTime", "now"}});
  EXPECT_EQ(entryOf(made, "eventTime"), Value(1000000025.5));
  EXPECT_EQ(made.size(), 15u);
}

TEST_F(HTTPSPostBackendRecord, LeavesOutWhatIsNotKnown) {
  facts_.productVersion = std::nullopt;
  facts_.buildVersion = std::nullopt;
  facts_.hardwareType = std::nullopt;
  facts_.productFamily = std::nullopt;
  const Dictionary made = record();
  for (const char* key : {"_osVersion", "_build", "_productModel", "_productFamily"})
    EXPECT_FALSE(made.contains(key)) << key;
}

TEST_F(HTTPSPostBackendRecord, SaysWhetherTheBuildIsInternal) {
  platform_.deviceProperties.setProperty("ReleaseType", "Internal");
  facts_.isInternal = false;  // the device says it, not the session
  EXPECT_EQ(entryOf(record(), "_internal"), Value(1u));
}

TEST_F(HTTPSPostBackendRecord, AnImpossibleTimeIsMinusOne) {
  for (const double start : {std::nan(""), -HUGE_VAL, HUGE_VAL}) {
    facts_.startTimeStamp = start;
    backend_.reset();
    const Dictionary made = record({}, {1, 0});
    EXPECT_EQ(entryOf(made, "_clientTS"), Value(-1.0)) << start;
    EXPECT_EQ(entryOf(made, "eventTime"), Value(-1.0)) << start;
  }
}

TEST_F(HTTPSPostBackendRecord, DoesNotChangeThePayload) {
  const Dictionary payload{{"_sender", "me"}};
  EXPECT_EQ(entryOf(record(payload), "_sender"), Value("QG"));
  EXPECT_EQ(payload, (Dictionary{{"_sender", "me"}}));
}

TEST_F(HTTPSPostBackendRecord, UserInformationThenSharedDataReplaceWhatIsThereAndAreFiltered) {
  decided();
  backend().setUserInfoDict(Dictionary{{"_sessionID", "user"}, {"both", "user"}, {"SECRET", 1}});
  Dictionary event{{"_sessionID", "fixed"}, {"k", 1}};
  const Dictionary shared{{"both", "shared"}, {"secret", 2}};
  backend().prepareEventForMessage(event, &shared);
  EXPECT_EQ(event, (Dictionary{{"_sessionID", "user"}, {"k", 1}, {"both", "shared"}}));
}

TEST_F(HTTPSPostBackendRecord, NeedsNeitherUserInformationNorSharedData) {
  backend().setUserInfoDict(std::nullopt);
  Dictionary event{{"k", 1}};
  backend().prepareEventForMessage(event, nullptr);
  EXPECT_EQ(event, (Dictionary{{"k", 1}}));
}

TEST_F(HTTPSPostBackendRecord, OfManyEntriesKeepsThemAll) {
  Dictionary payload;
  for (int i = 0; i < 100; ++i) payload.set(String("key" + std::to_string(i)), i);
  const Dictionary made = record(payload);
  EXPECT_EQ(made.size(), 115u);
  EXPECT_EQ(entryOf(made, "key99"), Value(99));
  EXPECT_EQ(entryOf(made, "_method"), Value(5u));
}

TEST_F(HTTPSPostBackendRecord, OfAStopMessageCarriesTheSamplingEntries) {
  entry_.set("event_threshold", 10);
  decided();
  send(0, {{"Opt", "mine"}}, 0, 1);
  backend().flushMessagesWithCompletion(nullptr);
  const Dictionary stop = events(0).at(0);
  EXPECT_EQ(entryOf(stop, "Opt"), Value(0));
  EXPECT_EQ(entryOf(stop, "SamplingThreshold"), Value(1.0));
  EXPECT_EQ(entryOf(stop, "OverrideSampling"), Value(-1));
  EXPECT_EQ(entryOf(stop, "Batch"), Value(1));
  EXPECT_TRUE(platform_.sink.contains(
      LogLevel::debug,
      "HTTPSPostBackend(sendMessage): Adding dnu type and sampling threshold to SESSION_TYPE_STOP message dictionary"));
}

TEST_F(HTTPSPostBackendRecord, OfAStopMessageSaysWhatTheEntryOverrides) {
  platform_.random.setDraw(50);
  entry_.set("override_dnu", 1);
  entry_.set("sampling_threshold", 0.1);
  entry_.set("override_sampling", 0.75);
  decided();
  send(0, {}, 2, 1);  // frees the held back end
  backend().flushMessagesWithCompletion(nullptr);
  const Dictionary stop = events(0).at(0);
  EXPECT_EQ(entryOf(stop, "Opt"), Value(2));
  EXPECT_EQ(entryOf(stop, "SamplingThreshold"), Value(0.1));
  EXPECT_EQ(entryOf(stop, "OverrideSampling"), Value(0.75));
}

TEST_F(HTTPSPostBackendRecord, OfAStopMessageWithoutThresholdSaysMinusOne) {
  facts_.requireUserInfo = false;
  backend().setBatchEvents(false);
  decided();
  send(0, {}, 0, 1);
  const Dictionary stop = events(0).at(0);
  EXPECT_EQ(entryOf(stop, "SamplingThreshold"), Value(-1));
  EXPECT_EQ(entryOf(stop, "Batch"), Value(0));
}

TEST_F(HTTPSPostBackendRecord, OfAnyOtherMessageDoesNot) {
  decided();
  send(0, {}, 0, 0);
  send(1, {}, 0, 1);
  backend().flushMessagesWithCompletion(nullptr);
  for (const Dictionary& event : events(0)) EXPECT_FALSE(event.contains("Opt"));
}

TEST_F(HTTPSPostBackendRecord, IsMadeOfTheMessageItselfWithoutClientData) {
  decided();
  backend().sendMessage({{"bare", 1}}, {1, 0}, 5, 2, MessageFlag{});
  backend().flushMessagesWithCompletion(nullptr);
  EXPECT_EQ(entryOf(events(0).at(0), "bare"), Value(1));
}

TEST_F(HTTPSPostBackendRecord, ClientDataThatIsNoDictionaryCountsAsMissing) {
  decided();
  backend().sendMessage({{kKYTReportingMessageBlobClientData, Array{1}}, {"other", 1}}, {1, 0}, 5, 2,
                        MessageFlag{});
  backend().flushMessagesWithCompletion(nullptr);
  EXPECT_FALSE(events(0).at(0).contains("other"));
  EXPECT_EQ(entryOf(events(0).at(0), "_method"), Value(5));
  EXPECT_EQ(
      platform_.sink.count(LogLevel::error,
                           "HTTPSPostBackend(sendMessage): SESSION_TYPE_STOP message dictionary is nil"),
      1u);
}

TEST_F(HTTPSPostBackendRecord, NumbersEventsWithTheBackEndsOwnCounter) {
  decided();
  send(5);
  send(5);
  backend().flushMessagesWithCompletion(nullptr);
  EXPECT_EQ(entryOf(events(0).at(0), "_eventNumber"), Value(1));
  EXPECT_EQ(entryOf(events(0).at(1), "_eventNumber"), Value(2));
}

TEST_F(HTTPSPostBackendRecord, NumbersAdvanceForEventsThatTheStateDrops) {
  decided();
  backend().setState(kBackendStateDisabled);
  send(5);
  backend().setState(kBackendStateEnabled);
  send(5);
  backend().flushMessagesWithCompletion(nullptr);
  EXPECT_EQ(entryOf(events(0).at(0), "_eventNumber"), Value(2));
}

}  // namespace
}  // namespace kyt
