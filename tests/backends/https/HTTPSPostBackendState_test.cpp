// How the back end is made, and what the storebag's client entry makes of it.
#include <limits>

#include "tests/backends/https/HTTPSFixture.h"

namespace kyt {
namespace {

class HTTPSPostBackendState : public HTTPSFixture {
 protected:
  int32_t decide() { return backend().updateBackendState(); }
  std::shared_ptr<HTTPSPostBackend> init(std::optional<String> name, std::optional<Dictionary> profile) {
    return HTTPSPostBackend::initWithName(platform_.configuration, name, profile,
                                          std::make_shared<SessionFacts>());
  }
  bool logged(const char* text, LogLevel level = LogLevel::debug) const {
    return platform_.sink.contains(level, text);
  }
  void setDefault(const char* key, Value value) {
    platform_.userDefaults.put(kKYTReportingDefaultsDomain, key, std::move(value));
  }
};

TEST_F(HTTPSPostBackendState, NeedsANameAndAProfile) {
  const Dictionary profile{{"clients", Array{}}};
  EXPECT_EQ(init(std::nullopt, profile), nullptr);
  EXPECT_EQ(init(String("a"), std::nullopt), nullptr);
  EXPECT_NE(init(String("a"), profile), nullptr);
}

TEST_F(HTTPSPostBackendState, NeedsAListOfClients) {
  EXPECT_EQ(init(String("a"), Dictionary{}), nullptr);
  EXPECT_EQ(init(String("a"), Dictionary{{"clients", "all"}}), nullptr);
  EXPECT_EQ(
      platform_.sink.count(LogLevel::error, "HTTPSPostBackend(initWithName): can't find the client list."),
      2u);
}

TEST_F(HTTPSPostBackendState, BeginsUndecidedWithItsDisplayAddress) {
  profileExtras_ = {{"display_url", "https://display.example.org"}};
  EXPECT_EQ(backend().state(), kBackendStateUndecided);
  EXPECT_EQ(backend().displayURL(), String("https://display.example.org"));
  EXPECT_EQ(backend().eventThreshold(), 49);
  EXPECT_FALSE(backend().postURL());
}

TEST_F(HTTPSPostBackendState, IsEnabledByAnEntryThatFits) {
  backend().updateState();
  EXPECT_EQ(backend().state(), kBackendStateEnabled);
  EXPECT_EQ(backend().postURL(), String("https://post.example.org/events"));
  EXPECT_EQ(backend().realtimePostURL(), String("https://post.example.org/realtime"));
  EXPECT_EQ(backend().numberOfFilters(), 1);
  EXPECT_TRUE(
      logged("HTTPSPostBackend(updatePostLink): Storebag 'https://post.example.org/events' for postURL"));
  EXPECT_TRUE(logged(
      "HTTPSPostBackend(updatePostLink): Storebag 'https://post.example.org/realtime' for realtimePostURL"));
  EXPECT_TRUE(logged("resetBackendStateWithClient: event_threshold set to 49"));
  EXPECT_TRUE(logged("setBackendStateWithClient: extras on internal is set to 0"));
  EXPECT_TRUE(
      logged("HTTPSPostBackend(updateBackendState): httppost: client found a:b, state=2, "
             "samplingFactor=0.000000"));
}

TEST_F(HTTPSPostBackendState, WithoutUserInformationIsUndecided) {
  userInfo_ = std::nullopt;
  EXPECT_EQ(decide(), kBackendStateUndecided);
  backend().setUserInfoDict(Dictionary{});
  EXPECT_EQ(decide(), kBackendStateUndecided);
}

TEST_F(HTTPSPostBackendState, WithoutAnEntryForItsClientIsDisabled) {
  entry_.set("client", "other,b");
  EXPECT_EQ(decide(), kBackendStateDisabled);
}

TEST_F(HTTPSPostBackendState, ClientNamesAreWholePiecesAndServiceNamesContainTheirs) {
  const String client("Call");
  const String service("example.org/Video");
  const auto matches = [&](Dictionary entry) {
    return backend().matchClientNameAndServiceID(entry, &client, &service);
  };
  EXPECT_TRUE(matches({}));
  EXPECT_TRUE(matches({{"client", ""}, {"service", ""}}));
  EXPECT_TRUE(matches({{"client", "other,CALL"}, {"service", "audio,VIDEO"}}));
  EXPECT_FALSE(matches({{"client", "Cal"}}));
  EXPECT_FALSE(matches({{"client", "other, Call"}}));  // pieces are not trimmed
  EXPECT_FALSE(matches({{"service", "audio"}}));
  EXPECT_FALSE(matches({{"service", ","}}));  // empty pieces match nothing
  EXPECT_FALSE(matches({{"client", ",,"}}));
}

TEST_F(HTTPSPostBackendState, AMissingNameMatchesOnlyAMissingList) {
  EXPECT_TRUE(backend().matchClientNameAndServiceID({}, nullptr, nullptr));
  EXPECT_FALSE(backend().matchClientNameAndServiceID({{"client", "a"}}, nullptr, nullptr));
  EXPECT_FALSE(backend().matchClientNameAndServiceID({{"service", "a"}}, nullptr, nullptr));
}

TEST_F(HTTPSPostBackendState, ComparesVersionsFieldByField) {
  const auto enabled = [this](const char* own, const char* since) {
    facts_.setSelfVersion(own);
    backend_.reset();
    return backend().isFrameworkEnabledForClient({{"enabledSince", since}});
  };
  EXPECT_TRUE(enabled("3.10.0", "3.2"));
  EXPECT_FALSE(enabled("3.1.9", "3.2"));
  EXPECT_TRUE(enabled("3.2.1", "3.2.1"));
  EXPECT_FALSE(enabled("3.2.0", "3.2.1"));
  EXPECT_TRUE(enabled("4.0.0", "3.9.9"));
  EXPECT_TRUE(enabled("1.0", "256"));  // cut to eight bits
  EXPECT_TRUE(backend().isFrameworkEnabledForClient({}));
}

TEST_F(HTTPSPostBackendState, OfTwoMatchingEntriesUsesTheFirst) {
  Dictionary second = entry_;
  second.set("post_url", "https://second.example.org");
  second.set("expedite", 1);
  make({entry_, second});
  EXPECT_EQ(decide(), kBackendStateEnabled);
  EXPECT_EQ(backend().postURL(), String("https://post.example.org/events"));
  EXPECT_TRUE(backend().batchEvents());
}

TEST_F(HTTPSPostBackendState, AnEntryThatIsTooNewIsSkippedButStillSaysWhetherToBatch) {
  Dictionary tooNew{
      {"client", "a"}, {"enabledSince", "99"}, {"expedite", 1}, {"post_url", "https://new.example.org"}};
  make({tooNew, entry_});
  EXPECT_EQ(decide(), kBackendStateEnabled);
  EXPECT_FALSE(backend().batchEvents());
  EXPECT_EQ(backend().postURL(), String("https://post.example.org/events"));
  EXPECT_TRUE(logged("HTTPSPostBackend(updateBackendState): Store bag override  _batchEvent=0"));
}

TEST_F(HTTPSPostBackendState, ExpediteZeroBatches) {
  entry_.set("expedite", 0);
  backend().setBatchEvents(false);
  decide();
  EXPECT_TRUE(backend().batchEvents());
  EXPECT_TRUE(logged("HTTPSPostBackend(updateBackendState): Store bag override  _batchEvent=1"));
}

TEST_F(HTTPSPostBackendState, AnyOtherValueOfExpediteDoesNotBatch) {
  for (const Value& value : {Value(2), Value(-1), Value(256), Value("3"), Value(true)}) {
    entry_.set("expedite", value);
    make({entry_}).updateState();
    EXPECT_FALSE(backend().batchEvents()) << description(value);
  }
}

TEST_F(HTTPSPostBackendState, AnyValueButZeroKeepsPostsOffCellularNetworks) {
  for (const Value& value : {Value(1), Value(2), Value(-1), Value(256), Value("3")}) {
    entry_.set("use_wifi_only", value);
    make({entry_}).updateState();
    EXPECT_TRUE(backend().shouldUseWiFiOnly()) << description(value);
  }
  entry_.set("use_wifi_only", 0);
  make({entry_}).updateState();
  EXPECT_FALSE(backend().shouldUseWiFiOnly());
}

TEST_F(HTTPSPostBackendState, ASessionThatNeedsNoUserInformationIsEnabledWhateverTheRules) {
  platform_.consent.setAllowed(false);
  userInfo_ = std::nullopt;
  entry_ = {{"client", "other"}, {"event_threshold", 7}};
  facts_.requireUserInfo = false;
  EXPECT_EQ(decide(), kBackendStateEnabled);
  EXPECT_EQ(backend().eventThreshold(), 0);  // no entry had an address
  EXPECT_FALSE(backend().postURL());
}

TEST_F(HTTPSPostBackendState, ASessionThatNeedsNoUserInformationTakesTheFirstAddress) {
  facts_.requireUserInfo = false;
  make({Dictionary{{"event_threshold", 1}},
        Dictionary{{"event_threshold", 2}, {"post_url", "https://two.example.org"}},
        Dictionary{{"event_threshold", 3}, {"post_url", "https://three.example.org"}}});
  EXPECT_EQ(decide(), kBackendStateEnabled);
  EXPECT_EQ(backend().postURL(), String("https://two.example.org"));
  EXPECT_EQ(backend().eventThreshold(), 2);
}

TEST_F(HTTPSPostBackendState, ConsentIsRequiredUnlessTheEntryOverridesIt) {
  platform_.consent.setAllowed(false);
  EXPECT_EQ(decide(), kBackendStateDisabled);
  EXPECT_TRUE(logged("HTTPSPostBackend(updateBackendState): reporting disabled by DNU: 0."));
  entry_.set("override_dnu", 2);
  backend_.reset();
  EXPECT_EQ(decide(), kBackendStateDisabled);
  EXPECT_TRUE(logged("HTTPSPostBackend(updateBackendState): reporting disabled by DNU: 2."));
  entry_.set("override_dnu", 1);
  backend_.reset();
  EXPECT_EQ(decide(), kBackendStateEnabled);
  EXPECT_EQ(backend().dnuType(), 1);
  platform_.consent.setAllowed(true);
  backend_.reset();
  EXPECT_EQ(decide(), kBackendStateEnabled);
  EXPECT_EQ(backend().dnuType(), 2);
}

TEST_F(HTTPSPostBackendState, ReadsTheConsentOnce) {
  backend();
  platform_.consent.setAllowed(false);
  EXPECT_EQ(decide(), kBackendStateEnabled);
}

TEST_F(HTTPSPostBackendState, NeedsAListOfCountries) {
  entry_.remove("locale_whitelist");
  EXPECT_EQ(decide(), kBackendStateDisabled);
  EXPECT_TRUE(logged("HTTPSPostBackend(updateBackendState): (US) isn't in country code list (null)"));
}

TEST_F(HTTPSPostBackendState, NeedsItsCountryInTheList) {
  entry_.set("locale_whitelist", Array{"DE", "FR"});
  EXPECT_EQ(decide(), kBackendStateDisabled);
  EXPECT_TRUE(
      logged("HTTPSPostBackend(updateBackendState): (US) isn't in country code list [\"DE\",\"FR\"]"));
  platform_.deviceProperties.setCountryCode("de");
  EXPECT_EQ(decide(), kBackendStateEnabled);
}

TEST_F(HTTPSPostBackendState, ADeviceWithoutACountryPassesAListThatIsNotEmpty) {
  platform_.deviceProperties.setCountryCode(std::nullopt);
  entry_.set("per_country_sampling_thresholds",
             Array{Dictionary{{"country", Array{"US"}}, {"threshold", 0.0}}});
  EXPECT_EQ(decide(), kBackendStateEnabled);
  EXPECT_EQ(backend().samplingThreshold(), Value(1.0));
  entry_.set("locale_whitelist", Array{});
  backend_.reset();
  EXPECT_EQ(decide(), kBackendStateDisabled);
  EXPECT_TRUE(logged("HTTPSPostBackend(updateBackendState): ((null)) isn't in country code list []"));
}

TEST_F(HTTPSPostBackendState, DeviceListsAdmitFamiliesAndExcludeModels) {
  entry_.set("device_whitelist", Array{"Tablet"});
  EXPECT_EQ(decide(), kBackendStateDisabled);
  EXPECT_TRUE(logged("HTTPSPostBackend(updateBackendState): (Phone) isn't in device whitelist [\"Tablet\"]"));
  entry_.set("device_whitelist", Array{"phone"});
  entry_.set("device_blacklist", Array{"phone9"});
  backend_.reset();
  EXPECT_EQ(decide(), kBackendStateDisabled);
  EXPECT_TRUE(logged("HTTPSPostBackend(updateBackendState): (Phone9,1) is in device blacklist [\"phone9\"]"));
  entry_.set("device_blacklist", Array{"phone8"});
  backend_.reset();
  EXPECT_EQ(decide(), kBackendStateEnabled);
}

TEST_F(HTTPSPostBackendState, AListThatRefusesTheDeviceDoesNotGoOnToTheNextEntry) {
  for (const char* list : {"locale_whitelist", "device_whitelist"}) {
    Dictionary first = entry_;
    first.set(list, Array{"elsewhere"});
    backend_.reset();
    make({first, entry_});
    EXPECT_EQ(decide(), kBackendStateDisabled) << list;
  }
}

TEST_F(HTTPSPostBackendState, AnUnknownModelIsInEveryBlacklist) {
  entry_.set("device_blacklist", Array{"phone8"});
  facts_.hardwareType = std::nullopt;
  EXPECT_EQ(decide(), kBackendStateDisabled);
  EXPECT_TRUE(logged("HTTPSPostBackend(updateBackendState): ((null)) is in device blacklist [\"phone8\"]"));
}

TEST_F(HTTPSPostBackendState, NeedsFilters) {
  entry_.remove("filters");
  EXPECT_EQ(decide(), kBackendStateDisabled);
  EXPECT_TRUE(logged("HTTPSPostBackend(updateBackendState): filters are required.", LogLevel::error));
}

TEST_F(HTTPSPostBackendState, EmptyFiltersAreFilters) {
  entry_.set("filters", Array{});
  EXPECT_EQ(decide(), kBackendStateEnabled);
}

TEST_F(HTTPSPostBackendState, FiltersAreThereWhateverTheSamplingDecides) {
  entry_.remove("sampling_threshold");
  EXPECT_EQ(decide(), kBackendStateDisabled);
  EXPECT_EQ(backend().numberOfFilters(), 1);
  platform_.random.setDraw(50);
  entry_.set("sampling_threshold", 0.1);
  backend_.reset();
  EXPECT_EQ(decide(), kBackendStateHeld);
  EXPECT_EQ(backend().numberOfFilters(), 1);
  backend().setState(kBackendStateHeld);
  send(5, {{"secret", "s"}, {"k", 1}});
  backend().setState(kBackendStateEnabled);
  backend().flushMessagesWithCompletion(nullptr);
  EXPECT_FALSE(events(0).at(0).contains("secret")) << "filtered when it was made, not only when it left";
}

TEST_F(HTTPSPostBackendState, ARuleThatDisablesBuildsNoFilters) {
  entry_.set("device_whitelist", Array{"Tablet"});
  EXPECT_EQ(decide(), kBackendStateDisabled);
  EXPECT_EQ(backend().numberOfFilters(), 0);
}

struct Draw {
  uint32_t draw;
  Value threshold, override;
  int32_t state;
};

class SamplingTest : public HTTPSPostBackendState, public testing::WithParamInterface<Draw> {};

TEST_P(SamplingTest, DecidesTheState) {
  platform_.random.setDraw(GetParam().draw);
  entry_.remove("sampling_threshold");
  if (!GetParam().threshold.isNull()) entry_.set("sampling_threshold", GetParam().threshold);
  if (!GetParam().override.isNull()) entry_.set("override_sampling", GetParam().override);
  EXPECT_EQ(decide(), GetParam().state);
}

INSTANTIATE_TEST_SUITE_P(Draws, SamplingTest,
                         testing::Values(Draw{30, 0.3, {}, 2}, Draw{31, 0.3, {}, 3}, Draw{31, 0.3, 0.5, 3},
                                         Draw{31, 0.3, 0.2, 1}, Draw{31, 0.3, 0.31, 3}, Draw{0, {}, {}, 1},
                                         Draw{0, 0, {}, 2}, Draw{100, 1, {}, 2},
                                         Draw{31, 0.3, std::numeric_limits<double>::quiet_NaN(), 3}));

TEST_F(HTTPSPostBackendState, ACountrysThresholdReplacesTheGlobalOne) {
  platform_.random.setDraw(50);
  entry_.set("sampling_threshold", 0.1);
  entry_.set("per_country_sampling_thresholds",
             Array{Value("no dictionary"), Dictionary{{"country", "US"}, {"threshold", 0.0}},
                   Dictionary{{"country", Array{"DE", "US"}}, {"threshold", 0.5}},
                   Dictionary{{"country", Array{"US"}}, {"threshold", 0.2}}});
  EXPECT_EQ(decide(), kBackendStateEnabled);
  EXPECT_EQ(backend().samplingThreshold(), Value(0.5));
  EXPECT_TRUE(
      logged("HTTPSPostBackend(updateBackendState): sampling threshold for US changed from 0.10 to 0.50"));
}

// As doubles they would be 0.61499… and 0.84499…, and so 0.61 and 0.84.
TEST_F(HTTPSPostBackendState, ACountrysThresholdIsShownAsASinglePrecisionNumber) {
  entry_.set("sampling_threshold", 0.615);
  entry_.set("per_country_sampling_thresholds",
             Array{Dictionary{{"country", Array{"US"}}, {"threshold", 0.845}}});
  decide();
  EXPECT_TRUE(
      logged("HTTPSPostBackend(updateBackendState): sampling threshold for US changed from 0.62 to 0.85"));
}

TEST_F(HTTPSPostBackendState, ACountrysThresholdReplacesAMissingOneToo) {
  entry_.remove("sampling_threshold");
  entry_.set("per_country_sampling_thresholds",
             Array{Dictionary{{"country", Array{"US"}}, {"threshold", 0.5}}});
  EXPECT_EQ(decide(), kBackendStateEnabled);
  EXPECT_TRUE(
      logged("HTTPSPostBackend(updateBackendState): sampling threshold for US changed from 0.00 to 0.50"));
}

TEST_F(HTTPSPostBackendState, TakesTheSettingsOfTheEntryWhateverTheSampling) {
  platform_.random.setDraw(100);
  entry_.set("sampling_threshold", 0.1);
  entry_.set("event_threshold", 5);
  entry_.set("event_whitelist", Array{1, 2});
  entry_.set("event_blacklist", Array{2});
  entry_.set("use_wifi_only", 1);
  EXPECT_EQ(decide(), kBackendStateHeld);
  EXPECT_EQ(backend().eventThreshold(), 5);
  EXPECT_TRUE(backend().isWhitelistedEvent(1));
  EXPECT_FALSE(backend().isWhitelistedEvent(3));
  EXPECT_TRUE(backend().isBlacklistedEvent(2));
  EXPECT_TRUE(backend().shouldUseWiFiOnly());
  EXPECT_TRUE(logged("HTTPSPostBackend(updateBackendState): httppost: eventWhitelist=[1,2]"));
  EXPECT_TRUE(logged("HTTPSPostBackend(updateBackendState): httppost: eventBlacklist=[2]"));
}

TEST_F(HTTPSPostBackendState, ARuleThatDisablesLeavesTheSettingsAsTheyWere) {
  entry_.set("event_threshold", 5);
  entry_.set("event_whitelist", Array{1});
  entry_.set("device_whitelist", Array{"Tablet"});
  EXPECT_EQ(decide(), kBackendStateDisabled);
  EXPECT_EQ(backend().eventThreshold(), 49);
  EXPECT_FALSE(backend().postURL());
  EXPECT_TRUE(backend().isWhitelistedEvent(3));
}

TEST_F(HTTPSPostBackendState, WithoutARealtimeAddressUsesTheOrdinaryOne) {
  entry_.remove("realtime_post_url");
  decide();
  EXPECT_EQ(backend().realtimePostURL(), backend().postURL());
  EXPECT_TRUE(
      logged("HTTPSPostBackend(updatePostLink): realtimePostURL defaults to postURL "
             "'https://post.example.org/events'"));
}

TEST_F(HTTPSPostBackendState, AnAddressInTheUserDefaultsSurvivesTheStorebag) {
  setDefault("httpsPostURL", "https://mine.example.org");
  EXPECT_FALSE(backend().updatePostLink(entry_));
  EXPECT_EQ(decide(), kBackendStateEnabled);
  EXPECT_EQ(decide(), kBackendStateEnabled);
  EXPECT_EQ(backend().postURL(), String("https://mine.example.org"));
  EXPECT_EQ(backend().realtimePostURL(), String("https://post.example.org/realtime"));
  EXPECT_TRUE(
      logged("HTTPSPostBackend(initWithName): Using user default 'https://mine.example.org' for postURL"));
}

TEST_F(HTTPSPostBackendState, ARealtimeAddressInTheUserDefaultsSurvivesToo) {
  setDefault("httpsRealtimePostURL", "https://fast.example.org");
  decide();
  EXPECT_EQ(backend().postURL(), String("https://post.example.org/events"));
  EXPECT_EQ(backend().realtimePostURL(), String("https://fast.example.org"));
  EXPECT_TRUE(logged(
      "HTTPSPostBackend(initWithName): Using user default 'https://fast.example.org' for realtimePostURL"));
}

TEST_F(HTTPSPostBackendState, AUserDefaultThatWasTakenAwayGivesWayToTheStorebag) {
  setDefault("httpsPostURL", "https://mine.example.org");
  backend().setPostURL(std::nullopt);
  EXPECT_TRUE(backend().updatePostLink(entry_));
  EXPECT_EQ(backend().postURL(), String("https://post.example.org/events"));
  entry_.set("post_url", "https://later.example.org");
  EXPECT_TRUE(backend().updatePostLink(entry_));  // the storebag's for good
  EXPECT_EQ(backend().postURL(), String("https://later.example.org"));
}

TEST_F(HTTPSPostBackendState, TheCustomIdentifierIsMadeOnceForClientAndService) {
  entry_.set("custom_clientId", true);
  decide();
  const Value stored = platform_.userDefaults.value(kKYTReportingDefaultsDomain, "uuid:a:b");
  ASSERT_NE(stored.string(), nullptr);
  EXPECT_EQ(stored.string()->size(), 36u);
  EXPECT_TRUE(logged(
      ("getPersistentIdentifierForCustomClientIDSuffix: The value for uuid:a:b: " + stored.string()->str())
          .c_str(),
      LogLevel::normal));
  backend_.reset();
  decide();
  EXPECT_EQ(platform_.userDefaults.value(kKYTReportingDefaultsDomain, "uuid:a:b"), stored);
}

TEST_F(HTTPSPostBackendState, ACustomIdentifierThatCannotBeStoredStaysTheSameForClientAndService) {
  platform_.userDefaults.setFailsWrites(true);
  entry_ = {{"custom_clientId", true},
            {"locale_whitelist", Array{"US"}},
            {"filters", Array{}},
            {"sampling_threshold", 1.0}};
  const auto identifierOf = [&](const char* client) {
    backend().setUserInfoDict(
        Dictionary{{kKYTReportingUserInfoClientName, client}, {kKYTReportingUserInfoServiceName, "b"}});
    backend().updateState();
    const auto message = platform_.json.parse(*backend().createMessageForPostAndLogging(Array{}, nullptr));
    return std::get<Value>(message).dictionary()->find("clientId")->string()->str();
  };
  const std::string first = identifierOf("a"), other = identifierOf("z");
  EXPECT_EQ(first.size(), 36u);
  EXPECT_NE(other, first);
  EXPECT_EQ(identifierOf("a"), first);
  EXPECT_EQ(identifierOf("z"), other);
  platform_.userDefaults.setFailsWrites(false);
  EXPECT_EQ(identifierOf("a"), first);
  EXPECT_EQ(platform_.userDefaults.value(kKYTReportingDefaultsDomain, "uuid:a:b"), Value(first));
}

TEST_F(HTTPSPostBackendState, TheCustomIdentifierOfANamelessClientHasEmptyNames) {
  entry_ = {{"custom_clientId", true},
            {"locale_whitelist", Array{"US"}},
            {"filters", Array{}},
            {"sampling_threshold", 1.0}};
  userInfo_ = Dictionary{{"other", 1}};
  EXPECT_EQ(decide(), kBackendStateEnabled);
  EXPECT_NE(platform_.userDefaults.value(kKYTReportingDefaultsDomain, "uuid::").string(), nullptr);
}

TEST_F(HTTPSPostBackendState, EntriesThatAreNoDictionariesAreSkipped) {
  for (const bool required : {true, false}) {
    facts_.requireUserInfo = required;
    make({Value(1), Value("a"), entry_});
    EXPECT_EQ(decide(), kBackendStateEnabled);
  }
}

TEST_F(HTTPSPostBackendState, FollowsTheUserInformation) {
  decided();
  backend().setUserInfoDict(Dictionary{{kKYTReportingUserInfoClientName, "stranger"}});
  backend().updateState();
  EXPECT_EQ(backend().state(), kBackendStateDisabled);
  backend().setUserInfoDict(userInfo_);
  backend().updateState();
  EXPECT_EQ(backend().state(), kBackendStateEnabled);
}

TEST_F(HTTPSPostBackendState, ABackEndThatSamplingDisablesTakesTheSettingsToo) {
  entry_.remove("sampling_threshold");
  entry_.set("event_threshold", 5);
  EXPECT_EQ(decide(), kBackendStateDisabled);
  EXPECT_EQ(backend().eventThreshold(), 5);
  EXPECT_EQ(backend().postURL(), String("https://post.example.org/events"));
}

TEST_F(HTTPSPostBackendState, ACustomIdentifierIsMadeWheneverItsKeyIsThere) {
  entry_.set("custom_clientId", false);
  decide();
  EXPECT_NE(platform_.userDefaults.value(kKYTReportingDefaultsDomain, "uuid:a:b").string(), nullptr);
}

TEST_F(HTTPSPostBackendState, AFrozenStateIsNotWrittenAgain) {
  decided();
  send(5);
  backend().flushMessagesWithCompletion(nullptr);
  ASSERT_TRUE(backend().immutable());
  platform_.executor.runAll();
  backend().updateState();
  EXPECT_EQ(platform_.executor.pending(), 0u);  // or it would undo what a reply sets at this moment
}

TEST_F(HTTPSPostBackendState, AFlushThatWasShownFreezesTheState) {
  decided();
  send(5);
  backend().flushMessagesWithCompletion(nullptr);
  ASSERT_TRUE(backend().immutable());
  backend().setUserInfoDict(Dictionary{{kKYTReportingUserInfoClientName, "stranger"}});
  EXPECT_EQ(backend().updateBackendState(), kBackendStateEnabled);
  backend().setState(kBackendStateHeld);
  backend().updateState();
  EXPECT_EQ(backend().state(), kBackendStateHeld);
}

// A bag is signed, but what signs it may be wrong about types: every key with every kind of object, alone and
// inside the containers that are looked into.
TEST_F(HTTPSPostBackendState, NoTypeInTheEntryDoesHarm) {
  const std::byte bytes[] = {std::byte{1}};
  const double nan = std::numeric_limits<double>::quiet_NaN();
  const std::vector<Value> objects{Value(), true,      -5, 18446744073709551615u, 1e300,
                                   nan,     Date{nan}, "", "text, text",          Data(bytes)};
  std::vector<Value> kinds = objects;
  for (const Value& object : objects) {
    kinds.push_back(Value(Array{object, Array{object}}));
    for (const char* key : {"key", "action", "method", "status", "country", "threshold"})
      kinds.push_back(Value(Array{Dictionary{{key, object}}, Dictionary{{"country", Array{object}}}}));
    kinds.push_back(Value(Dictionary{{"key", object}}));
  }
  for (const char* key : {"client",
                          "service",
                          "enabledSince",
                          "expedite",
                          "override_dnu",
                          "locale_whitelist",
                          "device_whitelist",
                          "device_blacklist",
                          "filters",
                          "sampling_threshold",
                          "per_country_sampling_thresholds",
                          "override_sampling",
                          "event_threshold",
                          "extras_on_internal",
                          "custom_clientId",
                          "post_url",
                          "realtime_post_url",
                          "event_whitelist",
                          "event_blacklist",
                          "use_wifi_only"}) {
    for (const Value& kind : kinds) {
      Dictionary entry = entry_;
      entry.set(key, kind);
      for (const bool required : {true, false}) {
        facts_.requireUserInfo = required;
        make({entry}).updateState();
        EXPECT_GE(backend().state(), kBackendStateUndecided);
        EXPECT_LE(backend().state(), kBackendStateHeld);
        send(5);
        send(6, {{"email", kind}}, 1);
        backend().updateState();
        backend().flushMessagesWithCompletion(nullptr);
      }
    }
  }
}

// Each decision against posting is told at the default level, with whom it is about, once a minute.
class ToldDecisions : public HTTPSPostBackendState {
 protected:
  void expectTold(Reason reason, const std::string& why) {
    for (int i = 0; i < 2; ++i) {
      backend_.reset();
      decided();
    }
    EXPECT_EQ(dropped(reason), 2u);
    EXPECT_EQ(platform_.sink.count(
                  LogLevel::normal,
                  "HTTPSPostBackend(updateBackendState): httppost posts nothing of a:b, since " + why),
              1u)
        << why;
  }
};

TEST_F(ToldDecisions, NameTheConsent) {
  platform_.consent.setAllowed(false);
  expectTold(Reason::consentMissing, "the user has not given consent");
}

TEST_F(ToldDecisions, NameTheCountry) {
  platform_.deviceProperties.setCountryCode("FR");
  expectTold(Reason::countryNotListed, "the storebag's entry does not list this country");
}

TEST_F(ToldDecisions, NameTheDevice) {
  entry_.set("device_whitelist", Array{"Watch"});
  expectTold(Reason::deviceNotListed, "the storebag's entry does not list this device");
}

TEST_F(ToldDecisions, NameTheExcludedDevice) {
  entry_.set("device_blacklist", Array{"Phone9"});
  expectTold(Reason::deviceNotListed, "the storebag's entry excludes this device");
}

TEST_F(ToldDecisions, NameTheClientThatNoEntryIsFor) {
  entry_.set("client", "another");
  expectTold(Reason::clientNotListed, "no entry of the storebag is for this client");
}

TEST_F(ToldDecisions, NameAMissingThreshold) {
  entry_.remove("sampling_threshold");
  expectTold(Reason::samplingThresholdMissing, "the storebag's entry has no sampling_threshold");
}

TEST_F(ToldDecisions, NameTheDraw) {
  entry_.set("sampling_threshold", -1.0);
  expectTold(Reason::sampledOut, "this session was not drawn");
}

TEST_F(ToldDecisions, AreNoneOfABackEndThatPosts) {
  decided();
  EXPECT_EQ(platform_.sink.count("posts nothing"), 0u);
}

}  // namespace
}  // namespace kyt
