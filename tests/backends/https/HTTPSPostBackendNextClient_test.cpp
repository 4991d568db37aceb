// One session, several client entries: what the decision for one client leaves to the next, and what it does
// not.
#include "tests/backends/https/HTTPSFixture.h"

namespace kyt {
namespace {

// Entry "a" decides first, then the user information changes and entry "c" decides.
class HTTPSPostBackendNextClient : public HTTPSFixture {
 protected:
  HTTPSPostBackendNextClient() { next_.set("client", "c"); }
  int32_t decideForBoth() {
    make({entry_, next_}).updateState();
    backend().setUserInfoDict(
        Dictionary{{kKYTReportingUserInfoClientName, "c"}, {kKYTReportingUserInfoServiceName, "b"}});
    backend().updateState();
    return backend().state();
  }
  // The record of a stop message, sent alone.
  Dictionary stopRecord() {
    backend().setBatchEvents(false);
    send(0, {}, 0, 1);
    return events(poster_->requests.size() - 1).at(0);
  }
  Dictionary next_ = entry_;
};

TEST_F(HTTPSPostBackendNextClient, RespectsTheConsentAgain) {
  entry_.set("override_dnu", 1);
  decideForBoth();
  EXPECT_EQ(backend().dnuType(), 0);
}

TEST_F(HTTPSPostBackendNextClient, HasNoOverrideOfTheSampling) {
  platform_.random.setDraw(50);
  for (Dictionary* entry : {&entry_, &next_}) entry->set("sampling_threshold", 0.1);
  entry_.set("override_sampling", 0.2);
  EXPECT_EQ(decideForBoth(), kBackendStateHeld);
}

TEST_F(HTTPSPostBackendNextClient, MayUseCellularAccessAgain) {
  entry_.set("use_wifi_only", 1);
  decideForBoth();
  EXPECT_FALSE(backend().shouldUseWiFiOnly());
}

TEST_F(HTTPSPostBackendNextClient, KeepsItsListsWhereItsEntryHasNone) {
  entry_.set("event_whitelist", Array{1, 2});
  entry_.set("event_blacklist", Array{2});
  EXPECT_EQ(decideForBoth(), kBackendStateEnabled);
  EXPECT_TRUE(backend().isWhitelistedEvent(1));
  EXPECT_FALSE(backend().isWhitelistedEvent(3));
  EXPECT_TRUE(backend().isBlacklistedEvent(2));
}

TEST_F(HTTPSPostBackendNextClient, HasTheListsOfItsEntry) {
  entry_.set("event_whitelist", Array{1});
  entry_.set("event_blacklist", Array{2});
  next_.set("event_whitelist", Array{3});
  next_.set("event_blacklist", Array{4});
  decideForBoth();
  EXPECT_FALSE(backend().isWhitelistedEvent(1));
  EXPECT_TRUE(backend().isWhitelistedEvent(3));
  EXPECT_FALSE(backend().isBlacklistedEvent(2));
  EXPECT_TRUE(backend().isBlacklistedEvent(4));
}

TEST_F(HTTPSPostBackendNextClient, KeepsItsAddressWhereItsEntryHasNone) {
  next_.remove("post_url");
  next_.remove("realtime_post_url");
  EXPECT_EQ(decideForBoth(), kBackendStateEnabled);
  EXPECT_EQ(backend().postURL(), String("https://post.example.org/events"));
  EXPECT_EQ(backend().realtimePostURL(), backend().postURL()) << "the earlier realtime address is dropped";
}

TEST_F(HTTPSPostBackendNextClient, KeepsItsOwnIdentifierWhereItsEntryAsksForNone) {
  entry_.set("custom_clientId", 1);
  entry_.set("expedite", 1);
  EXPECT_EQ(decideForBoth(), kBackendStateEnabled);
  send(5);
  EXPECT_EQ(*message(0).dictionary()->find("clientId"),
            platform_.userDefaults.value(kKYTReportingDefaultsDomain, "uuid:a:b"));
  EXPECT_TRUE(platform_.userDefaults.value(kKYTReportingDefaultsDomain, "uuid:c:b").isNull());
}

TEST_F(HTTPSPostBackendNextClient, HasAnIdentifierOfItsOwnWhereItsEntryAsksForOne) {
  for (Dictionary* entry : {&entry_, &next_}) entry->set("custom_clientId", 1);
  entry_.set("expedite", 1);
  decideForBoth();
  send(5);
  EXPECT_EQ(*message(0).dictionary()->find("clientId"),
            platform_.userDefaults.value(kKYTReportingDefaultsDomain, "uuid:c:b"));
}

TEST_F(HTTPSPostBackendNextClient, KeepsTheBatchingThatAnEarlierEntryChose) {
  entry_.set("expedite", 1);
  decideForBoth();
  EXPECT_FALSE(backend().batchEvents()) << "the session asked for batches";
  entry_.set("expedite", 0);
  make({entry_, next_}).setBatchEvents(false);
  backend().updateState();
  EXPECT_TRUE(backend().batchEvents());
  backend().setUserInfoDict(
      Dictionary{{kKYTReportingUserInfoClientName, "c"}, {kKYTReportingUserInfoServiceName, "b"}});
  backend().updateState();
  EXPECT_TRUE(backend().batchEvents());
}

// The override is read only where the draw is above the threshold; a decision that does not come to it leaves
// what was read before, and stop messages tell that.
TEST_F(HTTPSPostBackendNextClient, KeepsTheOverrideThatItsDecisionDoesNotReach) {
  platform_.random.setDraw(50);
  entry_.set("sampling_threshold", 0.1);
  entry_.set("override_sampling", 0.75);
  EXPECT_EQ(decideForBoth(), kBackendStateEnabled);
  EXPECT_EQ(*stopRecord().find("OverrideSampling"), Value(0.75));
  EXPECT_EQ(*stopRecord().find("SamplingThreshold"), Value(1.0));
}

}  // namespace
}  // namespace kyt
