// Which storebags with a good signature are refused where the administrator says so, through the fetcher that asks; and that
// nothing of this counts otherwise.
#include "config/StorebagGuard.h"

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <variant>
#include <vector>

#include "config/StorebagFetcher.h"
#include "platform/UserDefaults.h"
#include "tests/support/SignedBag.h"
#include "tests/support/TestPlatform.h"

namespace kyt {
namespace {

constexpr int kTorvel = 5;
constexpr StorebagRefusals kOlder{true, false, false}, kExpired{false, true, false},
    kWithoutSHA256{false, false, true};

class StorebagGuardTest : public ::testing::Test {
 protected:
  StorebagGuardTest() { test_.clientBundle.setResource("publicKey", "der", testPublicKey()); }

  // As a daemon that starts now.
  void start(StorebagRefusals refusals) {
    fetcher_ = std::make_unique<StorebagFetcher>(test_.configuration, backendClassLock_, refusals);
  }
  [[nodiscard]] Dictionary bag(const Dictionary& further = {}) const {
    Dictionary made = releaseBag({{"httppost", Dictionary{{"active", true}}}});
    made.merge(further);
    return made;
  }
  // "taken", "not modified", or why not.
  std::string fetched(const std::string& document, const std::string& modified = "") {
    FakeURLSessionFactory::Headers headers;
    if (!modified.empty()) headers.emplace_back("Last-Modified", modified);
    const FakeURLSessionFactory::Reply reply{document.empty() ? 304 : 200, headers, document, std::nullopt};
    test_.urlSessions.setResponder([reply](const URLRequest&) { return reply; });
    const auto fetch = fetcher_->fetchStorebagForEnvironmentAndClientType(kTorvel, lastModified_);
    lastModified_ = fetch.lastModified;
    if (std::holds_alternative<StorebagFetcher::Section>(fetch.result)) return "taken";
    return std::holds_alternative<StorebagFetcher::NotModified>(fetch.result) ? "not modified"
                                                                              : fetch.problem;
  }
  std::string fetchedBag(const Dictionary& further) {
    return fetched(signedBag(bag(further), test_.propertyLists));
  }
  [[nodiscard]] int64_t now() const { return test_.clock.timeOfDay().seconds; }

  TestPlatform test_;
  Mutex backendClassLock_;
  std::unique_ptr<StorebagFetcher> fetcher_;
  std::optional<String> lastModified_;
};

TEST_F(StorebagGuardTest, RefusesALowerSerialThanOneTakenBefore) {
  start(kOlder);
  EXPECT_EQ(fetchedBag({{"serial", 7}}), "taken");
  EXPECT_EQ(fetchedBag({{"serial", 7}}), "taken") << "the same again";
  EXPECT_EQ(fetchedBag({{"serial", 6}}),
            "the storebag is refused: its serial is 6; one with the serial 7 was taken before");
  EXPECT_TRUE(test_.sink.contains(
      LogLevel::normal,
      "fetchStorebagWithName: The storebag is refused: its serial is 6; one with the serial 7 was taken before"));
  EXPECT_EQ(fetchedBag({{"serial", 8}}), "taken");
}

TEST_F(StorebagGuardTest, RefusesABagWithoutSerialAfterOneThatHadOne) {
  start(kOlder);
  EXPECT_EQ(fetchedBag({}), "taken") << "none was there before";
  EXPECT_EQ(fetchedBag({{"serial", 1}}), "taken");
  for (const Value& none : {Value(), Value("2"), Value(2.5), Value(true)})
    EXPECT_EQ(fetchedBag({{"serial", none}}),
              "the storebag is refused: it has no serial; one with the serial 1 was taken before");
}

TEST_F(StorebagGuardTest, RemembersTheSerialBeyondARestart) {
  start(kOlder);
  EXPECT_EQ(fetchedBag({{"serial", 7}}), "taken");
  start(kOlder);
  lastModified_.reset();
  EXPECT_NE(fetchedBag({{"serial", 6}}), "taken");
  static_cast<void>(test_.userDefaults.set(kStorebagDefaultsDomain, "torvel", Value()));
  start(kOlder);
  EXPECT_EQ(fetchedBag({{"serial", 6}}), "taken") << "an administrator let serials begin anew";
}

TEST_F(StorebagGuardTest, RemembersTheSerialWhereItCannotBeStored) {
  start(kOlder);
  test_.userDefaults.setFailsWrites(true);
  EXPECT_EQ(fetchedBag({{"serial", 7}}), "taken");
  EXPECT_TRUE(test_.sink.contains(LogLevel::normal,
                                  "fetchStorebagWithName: The serial of 'torvel' could not be stored, older "
                                  "ones count after a restart: writing fails"));
  EXPECT_NE(fetchedBag({{"serial", 6}}), "taken");
}

TEST_F(StorebagGuardTest, DoesNotRememberTheSerialOfABagThatWasNotTaken) {
  start(kOlder);
  EXPECT_NE(fetched(signedBag({{"serial", 9}, {"version", "1"}}, test_.propertyLists)), "taken")
      << "it has no section";
  EXPECT_EQ(fetchedBag({{"serial", 2}}), "taken");
}

TEST_F(StorebagGuardTest, AsksAgainWithTheTimeOfTheLastGoodBagAfterARefusedOne) {
  start(kOlder);
  EXPECT_EQ(fetched(signedBag(bag({{"serial", 7}}), test_.propertyLists), "Mon, 2 Feb 2026 00:00:00 GMT"),
            "taken");
  EXPECT_NE(fetched(signedBag(bag({{"serial", 6}}), test_.propertyLists), "Mon, 1 Jan 2026 00:00:00 GMT"),
            "taken");
  EXPECT_EQ(lastModified_, String("Mon, 2 Feb 2026 00:00:00 GMT"));
}

TEST_F(StorebagGuardTest, RefusesABagFromItsExpiryOn) {
  start(kExpired);
  EXPECT_EQ(fetchedBag({{"expires", now() + 60}}), "taken");
  EXPECT_EQ(fetchedBag({{"expires", Date{static_cast<double>(now() + 60)}}}), "taken");
  EXPECT_EQ(fetchedBag({}), "taken") << "it does not expire";
  EXPECT_EQ(fetchedBag({{"expires", now()}}),
            "the storebag is refused: it expired at 2026-01-31 12:00:00 +0000");
  EXPECT_EQ(fetchedBag({{"expires", "soon"}}),
            "the storebag is refused: its \"expires\" is neither a date nor a number");
}

TEST_F(StorebagGuardTest, DoesNotBelieveThatAnExpiredBagStillHolds) {
  start(kExpired);
  const std::string date = "Mon, 1 Jan 2026 00:00:00 GMT";
  EXPECT_EQ(fetched(signedBag(bag({{"expires", now() + 60}}), test_.propertyLists), date), "taken");
  EXPECT_EQ(fetched("", date), "not modified");
  test_.clock.advance(std::chrono::seconds(61));
  EXPECT_EQ(fetched("", date), "the storebag is refused: it expired at 2026-01-31 12:01:00 +0000");
}

TEST_F(StorebagGuardTest, RefusesABagWithoutAGoodSignatureOverSHA256) {
  start(kWithoutSHA256);
  const std::string refused = "the storebag is refused: it has no \"signature256\" that verifies";
  EXPECT_EQ(fetched(doublySignedBag(bag(), test_.propertyLists)), "taken");
  EXPECT_EQ(fetched(signedBag(bag(), test_.propertyLists)), refused);
  // The second signature of another bag.
  std::string document = doublySignedBag(bag(), test_.propertyLists);
  const std::string other = doublySignedBag(bag({{"serial", 2}}), test_.propertyLists);
  const size_t at = document.find("signature256"), from = other.find("signature256"), length = 40 + 344;
  document.replace(at, length, other, from, length);
  EXPECT_EQ(fetched(document), refused);
}

TEST_F(StorebagGuardTest, TakesTheSecondKeysSignatureOverSHA256) {
  start(kWithoutSHA256);
  test_.clientBundle.setResource("publicKey", "der", otherPublicKey());
  test_.clientBundle.setResource("publicKey2", "der", testPublicKey());
  EXPECT_EQ(fetched(doublySignedBag(bag(), test_.propertyLists)), "taken");
}

// What a fetcher says and does with the three keys must be what it says and does without them.
TEST_F(StorebagGuardTest, LooksAtNothingUnlessToldTo) {
  const auto course = [this](bool withKeys) {
    test_.sink.clear();
    test_.userDefaults.removeAll();
    lastModified_.reset();
    start({});
    const std::vector<Dictionary> sequence = {{{"serial", 7}, {"expires", now() + 60}},
                                              {{"serial", 6}, {"expires", now() - 60}},
                                              {{"expires", "soon"}},
                                              {{"serial", "x"}}};
    std::string told;
    int day = 1;
    for (const Dictionary& keys : sequence) {
      const Dictionary whole = bag(withKeys ? keys : Dictionary());
      told += fetched(
          withKeys ? doublySignedBag(whole, test_.propertyLists) : signedBag(whole, test_.propertyLists),
          "Mon, " + std::to_string(day++) + " Jan 2026 00:00:00 GMT");
      const size_t last = test_.urlSessions.requestCount() - 1;
      told += "\n" + test_.urlSessions.requestHeader(last, "If-Modified-Since").value_or("-") + "\n";
    }
    test_.clock.advance(std::chrono::seconds(120));
    told += fetched("", "Mon, 4 Jan 2026 00:00:00 GMT") + "\n";
    for (const auto& line : test_.sink.lines()) told += line.line + "\n";
    return told;
  };
  const int writes = test_.userDefaults.writes();
  const std::string without = course(false);
  EXPECT_NE(without.find("taken\n"), std::string::npos);
  EXPECT_NE(without.find("not modified\n"), std::string::npos);
  EXPECT_EQ(course(true), without);
  EXPECT_EQ(test_.userDefaults.writes(), writes);
}

}  // namespace
}  // namespace kyt
