// The storebag cache.
#include <thread>
#include <vector>

#include "platform/UserDefaults.h"
#include "tests/daemon/AgentFixture.h"

namespace kyt {
namespace {

class AgentStorebags : public AgentFixture {
 protected:
  std::optional<Dictionary> storebag(const Client& client) {
    return agent_.storebagForSession(*client.session);
  }
  size_t requests() { return test_.urlSessions.requestCount(); }
  const Dictionary section_ = table({"httppost"});
};

TEST_F(AgentStorebags, IsFetchedOnceWhileItIsFresh) {
  serve(releaseBag(section_, "7.7"), {{"Cache-Control", "max-age=600"}});
  const Client a = clientWith(sessionInfo(5, 4)), b = clientWith(sessionInfo(5));
  EXPECT_FALSE(agent_.storebagVersionForSession(*a.session));
  EXPECT_EQ(storebag(a), section_);
  EXPECT_TRUE(
      logged(LogLevel::debug, "storebagForSession: Retrieving storebag for session 4 with client type 5"));
  EXPECT_TRUE(logged(LogLevel::debug, "fetchAndCacheStorebag: Fetching storebag for client type 5"));
  EXPECT_TRUE(logged(LogLevel::debug, "fetchAndCacheStorebag: Storebag max age: 600 seconds"));
  EXPECT_EQ(agent_.storebagVersionForSession(*b.session), String("7.7"));
  test_.clock.advance(std::chrono::seconds(599));
  EXPECT_EQ(storebag(b), section_);
  EXPECT_EQ(requests(), 1U);
  EXPECT_TRUE(logged(LogLevel::debug, "storebagForSession: Cached storebag found for client type 5"));
  test_.clock.advance(std::chrono::seconds(1));
  EXPECT_EQ(storebag(b), section_);
  EXPECT_EQ(requests(), 2U);
}

TEST_F(AgentStorebags, TypesThatShareAStorebagShareItsEntry) {
  const Client a = clientWith(sessionInfo(7)), b = clientWith(sessionInfo(11));
  EXPECT_TRUE(storebag(a));
  EXPECT_TRUE(storebag(b));
  EXPECT_EQ(requests(), 1U);
}

TEST_F(AgentStorebags, ATypeWithoutAStorebagGetsNone) {
  const Client a = clientWith(sessionInfo(3)), unidentified = connect();
  EXPECT_FALSE(storebag(a));
  EXPECT_TRUE(logged(LogLevel::error, "fetchAndCacheStorebag: clientType 3 is invalid"));
  EXPECT_FALSE(storebag(unidentified));
  EXPECT_TRUE(logged(LogLevel::error, "fetchAndCacheStorebag: clientType 0 is invalid"));
  EXPECT_EQ(requests(), 0U);
}

TEST_F(AgentStorebags, AFailureKeepsFromTheNextFetchForFifteenMinutes) {
  serveNothing();
  const Client a = clientWith(sessionInfo(5));
  EXPECT_FALSE(storebag(a));
  EXPECT_TRUE(logged(LogLevel::error, "fetchAndCacheStorebag: Unable to fetch storebag for client type 5"));
  EXPECT_TRUE(logged(LogLevel::debug, "fetchAndCacheStorebag: Storebag max age: 0 seconds"));
  serve(releaseBag(section_));
  test_.clock.advance(std::chrono::seconds(899));
  EXPECT_FALSE(storebag(a));
  EXPECT_TRUE(logged(
      LogLevel::normal,
      "storebagForSession: Not fetching storebag for client type 5 - must wait 900 seconds between attempts"));
  test_.clock.advance(std::chrono::seconds(1));
  EXPECT_EQ(storebag(a), section_);
  EXPECT_EQ(requests(), 2U);
}

// A download may take its 15 seconds; what it brought is fresh from its end.
TEST_F(AgentStorebags, AgesFromTheEndOfTheFetch) {
  FakeURLSessionFactory::Reply reply;
  reply.headers = {{"Cache-Control", "max-age=600"}};
  reply.body = signedBag(releaseBag(section_), test_.propertyLists);
  test_.urlSessions.setResponder([this, reply](const URLRequest&) {
    test_.clock.advance(std::chrono::seconds(15));
    return reply;
  });
  const Client a = clientWith(sessionInfo(5));
  EXPECT_EQ(storebag(a), section_);
  test_.clock.advance(std::chrono::seconds(599));
  EXPECT_EQ(storebag(a), section_);
  EXPECT_EQ(requests(), 1U);
  test_.clock.advance(std::chrono::seconds(1));
  EXPECT_EQ(storebag(a), section_);
  EXPECT_EQ(requests(), 2U);
}

TEST_F(AgentStorebags, WaitsFromTheEndOfAFetchThatFailed) {
  FakeURLSessionFactory::Reply reply;
  reply.error = Error{kKYTURLErrorDomain, 28, "too slow"};
  test_.urlSessions.setResponder([this, reply](const URLRequest&) {
    test_.clock.advance(std::chrono::seconds(15));
    return reply;
  });
  const Client a = clientWith(sessionInfo(5));
  EXPECT_FALSE(storebag(a));
  test_.clock.advance(std::chrono::seconds(899));
  EXPECT_FALSE(storebag(a));
  EXPECT_EQ(requests(), 1U);
  test_.clock.advance(std::chrono::seconds(1));
  EXPECT_FALSE(storebag(a));
  EXPECT_EQ(requests(), 2U);
}

TEST_F(AgentStorebags, AReplyWithoutLastModifiedLeavesTheStoredOne) {
  serve(releaseBag(section_), {{"Last-Modified", "yesterday"}, {"Cache-Control", "max-age=60"}});
  const Client a = clientWith(sessionInfo(5));
  EXPECT_EQ(storebag(a), section_);
  serve(releaseBag(section_, "2.0"), {{"Cache-Control", "max-age=60"}});
  test_.clock.advance(std::chrono::seconds(60));
  EXPECT_EQ(storebag(a), section_);
  EXPECT_EQ(agent_.storebagVersionForSession(*a.session), String("2.0"));
  test_.clock.advance(std::chrono::seconds(60));
  EXPECT_EQ(storebag(a), section_);
  ASSERT_EQ(requests(), 3U);
  EXPECT_EQ(test_.urlSessions.requestHeader(2, "If-Modified-Since"), "yesterday");
}

TEST_F(AgentStorebags, AreThoseOfTheLatestIdentification) {
  Client a = clientWith(sessionInfo(5));
  EXPECT_TRUE(configure(a));
  identify(a, sessionInfo(8));
  EXPECT_TRUE(configure(a));
  ASSERT_EQ(requests(), 2U);
  EXPECT_NE(test_.urlSessions.request(0).url.find("/torvel?"), std::string::npos);
  EXPECT_NE(test_.urlSessions.request(1).url.find("/dulvek?"), std::string::npos);
}

TEST_F(AgentStorebags, ABadSignatureIsAFailureLikeAnyOther) {
  test_.clientBundle.setResource("publicKey", "der", otherPublicKey());
  const Client a = clientWith(sessionInfo(5));
  EXPECT_FALSE(storebag(a));
  EXPECT_FALSE(storebag(a));
  EXPECT_EQ(requests(), 1U);
}

// What a reply says about its lifetime counts for good ones alone.
TEST_F(AgentStorebags, ABadReplyIsAskedForAgainAfterFifteenMinutesWhateverLifetimeItHas) {
  for (const char* lifetime : {"max-age=86400", "max-age=1"}) {
    const size_t before = requests();
    test_.clientBundle.setResource("publicKey", "der", otherPublicKey());
    serve(releaseBag(section_), {{"Cache-Control", lifetime}});
    const Client a = clientWith(sessionInfo(5));
    test_.clock.advance(std::chrono::hours(25));
    EXPECT_EQ(storebag(a), before == 0 ? std::nullopt : std::optional(section_));
    test_.clock.advance(std::chrono::seconds(899));
    static_cast<void>(storebag(a));
    EXPECT_EQ(requests(), before + 1) << lifetime;
    test_.clientBundle.setResource("publicKey", "der", testPublicKey());
    test_.clock.advance(std::chrono::seconds(1));
    EXPECT_EQ(storebag(a), section_);
    EXPECT_EQ(requests(), before + 2) << lifetime;
  }
}

TEST_F(AgentStorebags, AFailedRefreshKeepsTheLastGoodSection) {
  const Client a = clientWith(sessionInfo(5));
  EXPECT_EQ(storebag(a), section_);
  serveNothing();
  test_.clock.advance(std::chrono::hours(25));
  EXPECT_EQ(storebag(a), section_);
  EXPECT_EQ(storebag(a), section_);
  EXPECT_EQ(requests(), 2U);
  EXPECT_EQ(agent_.storebagVersionForSession(*a.session), String("1.0"));
}

TEST_F(AgentStorebags, AnUnchangedBagCountsAsFetched) {
  Dictionary bag = releaseBag(section_);
  bag.set("refresh_cycle", 60);
  serve(bag, {{"Last-Modified", "yesterday"}});
  const Client a = clientWith(sessionInfo(5));
  EXPECT_EQ(storebag(a), section_);
  FakeURLSessionFactory::Reply unchanged;
  unchanged.status = 304;
  unchanged.headers = {{"Last-Modified", "yesterday"}, {"Cache-Control", "max-age=1000"}};
  test_.urlSessions.setResponder([unchanged](const URLRequest&) { return unchanged; });
  test_.clock.advance(std::chrono::seconds(60));
  EXPECT_EQ(storebag(a), section_);
  EXPECT_EQ(test_.urlSessions.requestHeader(1, "If-Modified-Since"), "yesterday");
  test_.clock.advance(std::chrono::seconds(999));
  EXPECT_FALSE(logged(LogLevel::error, "Unable to fetch storebag"));
  EXPECT_EQ(storebag(a), section_) << "the age comes from the header alone: the bag's own is not read again";
  EXPECT_EQ(requests(), 2U);
}

TEST_F(AgentStorebags, AClockThatWasSetBackCountsByItsDistance) {
  serve(releaseBag(section_), {{"Cache-Control", "max-age=600"}});
  const Client a = clientWith(sessionInfo(5));
  EXPECT_TRUE(storebag(a));
  TimeValue earlier = test_.clock.timeOfDay();
  earlier.seconds -= 599;
  test_.clock.setTimeOfDay(earlier);
  EXPECT_TRUE(storebag(a));
  EXPECT_EQ(requests(), 1U);
  earlier.seconds -= 2;
  test_.clock.setTimeOfDay(earlier);
  EXPECT_TRUE(storebag(a));
  EXPECT_EQ(requests(), 2U);
}

TEST_F(AgentStorebags, TheBuiltInBagHoldsForAnHour) {
  serveNothing();
  const Client a = clientWith(sessionInfo(7));
  EXPECT_EQ(storebag(a), (Dictionary{{"qdx", Dictionary{{"active", true}}}}));
  test_.clock.advance(std::chrono::seconds(3599));
  EXPECT_TRUE(storebag(a));
  EXPECT_EQ(requests(), 1U);
  test_.clock.advance(std::chrono::seconds(1));
  EXPECT_TRUE(storebag(a));
  EXPECT_EQ(requests(), 2U);
}

TEST_F(AgentStorebags, WithoutASectionForTheEnvironmentAFetchFails) {
  test_.userDefaults.put(kKYTReportingDefaultsDomain, "environmentType", 0);
  Client a = clientWith(sessionInfo(5));
  EXPECT_FALSE(storebag(a));
  EXPECT_FALSE(configure(a));
}

TEST_F(AgentStorebags, SeveralSessionsThatAskAtOnceFetchOnce) {
  std::vector<Client> clients;
  for (int i = 0; i < 6; ++i) clients.push_back(clientWith(sessionInfo(5)));
  test_.urlSessions.setResponder(nullptr);
  std::vector<std::optional<Dictionary>> answers(clients.size());
  std::vector<std::jthread> threads;
  for (size_t i = 0; i < clients.size(); ++i)
    threads.emplace_back([&, i] { answers[i] = storebag(clients[i]); });
  ASSERT_TRUE(test_.urlSessions.waitForRequests(1));
  ASSERT_TRUE(test_.urlSessions.complete(0, 200, {}, signedBag(releaseBag(section_), test_.propertyLists)));
  threads.clear();
  for (const auto& answer : answers) EXPECT_EQ(answer, section_);
  EXPECT_EQ(requests(), 1U);
}

}  // namespace
}  // namespace kyt
