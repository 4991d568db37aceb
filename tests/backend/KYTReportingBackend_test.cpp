// The common base of the back ends.
#include "backend/KYTReportingBackend.h"

#include <gtest/gtest.h>
#include <openssl/sha.h>

#include "backend/Text.h"
#include "platform/base/Counters.h"
#include "platform/base/Hex.h"
#include "platform/queues/SerialQueue.h"
#include "tests/support/TestPlatform.h"

namespace kyt {
namespace {

// A back end that remembers what reached its sending operation, and lets tests set the lists.
class RecordingBackend : public KYTReportingBackend {
 public:
  explicit RecordingBackend(Platform& platform)
      : KYTReportingBackend(Making(), platform, "name", {}, std::make_shared<SessionFacts>()) {}
  using KYTReportingBackend::sendMessage;
  using KYTReportingBackend::setEventBlacklist;
  using KYTReportingBackend::setEventWhitelist;
  Value sendMessage(Dictionary, const TimeValue&, uint16_t method, uint16_t, EventID eventID,
                    MessageFlag flag) override {
    lastEventID = static_cast<uint16_t>(eventID);
    lastFlag = flag;
    return Value(method);
  }
  std::shared_ptr<ReportingSessionConnectivityInterface> delegate() const { return connectivityDelegate(); }
  String identifier(bool respectDnu) { return getPersistentIdentifierForDNU(respectDnu); }

  uint16_t lastEventID = 0;
  MessageFlag lastFlag{};
};

class Poster : public ReportingSessionConnectivityInterface {
 public:
  void postURLRequestWithCompletionHandler(URLRequest, URLCompletion) override {}
};

class KYTReportingBackendTest : public testing::Test {
 protected:
  TestPlatform platform_;
  RecordingBackend& backend() {
    if (!backend_) backend_ = std::make_shared<RecordingBackend>(platform_.platform);
    return *backend_;
  }
  std::shared_ptr<RecordingBackend> backend_;
};

TEST_F(KYTReportingBackendTest, WithoutAWhitelistAllowsEveryCategory) {
  EXPECT_TRUE(backend().isWhitelistedEvent(7));
}

TEST_F(KYTReportingBackendTest, WithAnEmptyWhitelistRefusesEveryCategory) {
  backend().setEventWhitelist(Array{});
  EXPECT_FALSE(backend().isWhitelistedEvent(7));
}

TEST_F(KYTReportingBackendTest, AWhitelistAllowsWhatItHolds) {
  backend().setEventWhitelist(Array{3, "7", 65536 + 9});
  EXPECT_TRUE(backend().isWhitelistedEvent(3));
  EXPECT_TRUE(backend().isWhitelistedEvent(7));
  EXPECT_FALSE(backend().isWhitelistedEvent(8));
  EXPECT_FALSE(backend().isWhitelistedEvent(9));  // entries are compared as 32 bits, not cut to 16
}

TEST_F(KYTReportingBackendTest, AnEntryThatIsNoNumberMatchesCategoryZero) {
  backend().setEventWhitelist(Array{"none"});
  backend().setEventBlacklist(Array{0});
  EXPECT_TRUE(backend().isWhitelistedEvent(0));
  EXPECT_TRUE(backend().isBlacklistedEvent(0));
}

TEST_F(KYTReportingBackendTest, AMissingOrEmptyBlacklistRefusesNothing) {
  EXPECT_FALSE(backend().isBlacklistedEvent(7));
  backend().setEventBlacklist(Array{});
  EXPECT_FALSE(backend().isBlacklistedEvent(7));
}

TEST_F(KYTReportingBackendTest, ABlacklistRefusesWhatItHoldsAndNoOther) {
  backend().setEventBlacklist(Array{7});
  EXPECT_TRUE(backend().isBlacklistedEvent(7));
  EXPECT_FALSE(backend().isBlacklistedEvent(6));
}

TEST(SessionFactsTest, ParseTheSelfVersion) {
  const auto parsed = [](const char* text) {
    SessionFacts facts;
    facts.setSelfVersion(text);
    return facts.selfVersion;
  };
  EXPECT_EQ(parsed("8.0"), (std::array<uint8_t, 3>{8, 0, 0}));
  EXPECT_EQ(parsed("10.2.3.4"), (std::array<uint8_t, 3>{10, 2, 3}));
  EXPECT_EQ(parsed("300"), (std::array<uint8_t, 3>{44, 0, 0}));
  EXPECT_EQ(parsed("abc"), (std::array<uint8_t, 3>{0, 0, 0}));
}

TEST_F(KYTReportingBackendTest, HashesTextAsTheStandardSays) {
  EXPECT_EQ(backend().convertIntoSHA256("abc"),
            "ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad");
}

TEST_F(KYTReportingBackendTest, HashesAsManyBytesAsTheTextHasCharacters) {
  const String umlauts("äöü");  // three characters, six bytes
  unsigned char digest[SHA256_DIGEST_LENGTH];
  SHA256(reinterpret_cast<const unsigned char*>(umlauts.c_str()), 3, digest);
  std::string expected;
  appendHex(std::as_bytes(std::span(digest)), expected);
  EXPECT_EQ(backend().convertIntoSHA256(umlauts), expected);
  EXPECT_EQ(backend().convertIntoSHA256("").size(), 64u);
}

TEST_F(KYTReportingBackendTest, NumbersEventsFromOne) {
  const TimeValue now{1, 0};
  for (uint16_t expected = 1; expected <= 3; ++expected) {
    EXPECT_EQ(backend().sendMessage({}, now, 5, 6, MessageFlag{2}), Value(5));
    EXPECT_EQ(backend().lastEventID, expected);
    EXPECT_EQ(backend().lastFlag, MessageFlag{2});
  }
}

TEST_F(KYTReportingBackendTest, TheEventNumberAfter65535IsZero) {
  for (int i = 0; i < 65535; ++i) backend().sendMessage({}, {}, 0, 0, MessageFlag{});
  EXPECT_EQ(backend().lastEventID, 65535);
  backend().sendMessage({}, {}, 0, 0, MessageFlag{});
  EXPECT_EQ(backend().lastEventID, 0);
}

TEST_F(KYTReportingBackendTest, AnswersAFlushAtOnceWithNothing) {
  int calls = 0;
  const Value result =
      backend().flushMessagesWithCompletion([&](const Value& value, const std::optional<Error>& error) {
        ++calls;
        EXPECT_TRUE(value.isNull());
        EXPECT_FALSE(error);
      });
  EXPECT_EQ(calls, 1);
  EXPECT_TRUE(result.isNull());
  EXPECT_TRUE(backend().flushMessagesWithCompletion(nullptr).isNull());
}

TEST(SessionFactsTest, StoreTheStartTimeAsSeconds) {
  SessionFacts facts;
  facts.setStartTimestamp({1, 500000});
  EXPECT_EQ(facts.startTimeStamp, 1.5);
}

TEST_F(KYTReportingBackendTest, ReadsTheStateThatWasWrittenBefore) {
  EXPECT_EQ(backend().state(), kBackendStateUndecided);
  backend().setState(3);
  backend().setState(1);
  EXPECT_EQ(backend().state(), 1);
  backend().updateState();
  EXPECT_EQ(backend().state(), kBackendStateEnabled);
}

TEST_F(KYTReportingBackendTest, AWriteOfTheStateWaitsForNobody) {
  backend().setState(2);
  EXPECT_EQ(platform_.executor.pending(), 1u);  // not stored yet: the queue was only asked to run
  platform_.executor.runAll();
  EXPECT_EQ(backend().state(), 2);
}

TEST_F(KYTReportingBackendTest, CanBeDestroyedWhileItsStateIsBeingWritten) {
  backend().setState(2);
  backend_.reset();
  EXPECT_EQ(platform_.executor.runAll(), 1u);
}

TEST_F(KYTReportingBackendTest, DrawsOneOf101SamplingFactors) {
  const auto drawn = [this](uint32_t draw) {
    platform_.random.setDraw(draw);
    return KYTReportingBackend::initWithName(platform_.platform, "a", {}, std::make_shared<SessionFacts>())
        ->samplingFactor();
  };
  EXPECT_EQ(drawn(0), 0.0);
  EXPECT_EQ(drawn(31), 0.31);
  EXPECT_EQ(drawn(100), 1.0);
  const std::vector<uint32_t> bounds = platform_.random.bounds();
  ASSERT_GE(bounds.size(), 3u);
  for (const uint32_t bound : bounds) EXPECT_EQ(bound, 101u);
}

TEST_F(KYTReportingBackendTest, TheBaseAloneDoesNothing) {
  SessionFacts facts;
  facts.productFamily = String("Phone");
  const auto plain = KYTReportingBackend::initWithName(platform_.platform, "a", {{"k", 1}},
                                                       std::make_shared<SessionFacts>(facts));
  EXPECT_EQ(plain->name(), "a");
  EXPECT_EQ(plain->profile().size(), 1u);
  EXPECT_EQ(plain->facts().productFamily, String("Phone"));
  EXPECT_TRUE(plain->sendMessage({}, {}, 1, 1, MessageFlag{}).isNull());
  EXPECT_TRUE(plain->sendMessage({}, {}, 1, 1, EventID{}).isNull());
  EXPECT_TRUE(plain->sendMessage({}, {}, 1, 1, EventID{}, MessageFlag{}).isNull());
  EXPECT_EQ(platform_.counters.value(Reason::notForThisBackEnd), 3u) << "each by itself";
  FileOffer offer(std::nullopt);
  EXPECT_FALSE(plain->uploadFileAtPath("/a", "token", offer));
  EXPECT_FALSE(plain->uploadLogData(Value(Array{})));
  EXPECT_EQ(plain->batchedEventsSize(), 0u);
  plain->cleanup();
}

TEST_F(KYTReportingBackendTest, TakesACorrelatedSessionID) {
  EXPECT_FALSE(backend().combinedSessionIDString());
  backend().setCorrelatedSessionID("1.2");
  EXPECT_EQ(backend().combinedSessionIDString(), String("1.2"));
}

TEST_F(KYTReportingBackendTest, DoesNotKeepItsPoster) {
  auto poster = std::make_shared<Poster>();
  backend().setReportingSessionConnectivityDelegate(poster);
  EXPECT_EQ(backend().delegate(), poster);
  poster.reset();
  EXPECT_EQ(backend().delegate(), nullptr);
}

TEST_F(KYTReportingBackendTest, MakesItsTwoIdentifiersOnceAndKeepsThem) {
  const String respects = backend().identifier(true);
  const String overrides = backend().identifier(false);
  EXPECT_EQ(respects.size(), 36u);
  EXPECT_NE(respects.view(), overrides.view());
  EXPECT_EQ(platform_.userDefaults.value(kKYTReportingDefaultsDomain, "uuidRespectDnu"), Value(respects));
  EXPECT_EQ(platform_.userDefaults.value(kKYTReportingDefaultsDomain, "uuidOverrideDnu"), Value(overrides));
  RecordingBackend other(platform_.platform);
  EXPECT_EQ(other.identifier(true), respects);
  EXPECT_EQ(platform_.userDefaults.writes(), 2);
}

TEST_F(KYTReportingBackendTest, TellsRealtimeAndExpediteFlagsByTheirWholeValues) {
  for (const int32_t flag : {1, 3}) EXPECT_TRUE(isRealtime(MessageFlag{flag}));
  for (const int32_t flag : {2, 3}) EXPECT_TRUE(isExpedite(MessageFlag{flag}));
  for (const int32_t flag : {0, 4, 5, 7, -1}) {
    EXPECT_FALSE(isRealtime(MessageFlag{flag}));
    EXPECT_FALSE(isExpedite(MessageFlag{flag}));
  }
}

}  // namespace
}  // namespace kyt
