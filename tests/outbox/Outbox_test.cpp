#include "outbox/Outbox.h"

#include <algorithm>
#include <limits>
#include <set>

#include "platform/base/Limits.h"
#include "tests/outbox/OutboxFixture.h"

namespace kyt {
namespace {

using std::chrono::hours;
using std::chrono::milliseconds;
using std::chrono::minutes;
using std::chrono::seconds;

class OutboxTest : public OutboxFixture {
 protected:
  // After many failures until shortly before half an hour has passed.
  void waitLong() { test_.random.setDraw(1799999); }
  [[nodiscard]] std::vector<std::string> openBodies() const {
    std::vector<std::string> bodies;
    for (size_t i = 0; i < network_->requestCount(); ++i)
      if (network_->isOpen(i)) bodies.push_back(body(i));
    return bodies;
  }
  void keepNumbered(int posts, std::string_view url = "") {
    for (int i = 0; i < posts; ++i) postAndKeep(std::to_string(i), 1000, url);
  }
  [[nodiscard]] size_t sent() const { return network_->requestCount(); }
};

TEST_F(OutboxTest, SendsTheOldestFirstAndOneAtATimeUntilOneIsTakenThenFour) {
  start();
  keepNumbered(12);
  EXPECT_TRUE(openBodies().empty());
  pass(seconds(5));
  EXPECT_EQ(openBodies(), std::vector<std::string>({"0"}));
  answer(last(), 200);
  EXPECT_EQ(openBodies(), std::vector<std::string>({"1", "2", "3", "4"}));
  answer(last(), 200);
  EXPECT_EQ(openBodies(), std::vector<std::string>({"1", "2", "3", "5"}));
  for (size_t i = 0; i < sent(); ++i)
    if (network_->isOpen(i)) answer(i, 503);
  EXPECT_TRUE(openBodies().empty()) << "it waits again";
  pass(minutes(1));
  EXPECT_EQ(openBodies(), std::vector<std::string>({"6"})) << "one of those that failed may be the reason";
  answer(last(), 200);
  EXPECT_EQ(openBodies(), std::vector<std::string>({"1", "2", "3", "5"}));
}

// "bad" is never taken, all others are.
class OutboxWithABadPost : public OutboxTest {
 protected:
  void begin() {
    start();
    waitLong();
    network_->setResponder([this](const URLRequest& request) {
      FakeURLSessionFactory::Reply reply;
      if (request.body.view() == "bad") {
        ++sentBad_;
        reply.status = badStatus_;
        if (!retryAfter_.empty()) reply.headers = {{"Retry-After", retryAfter_}};
        if (badStatus_ == 0) reply.error = Error{kKYTURLErrorDomain, 52, "closed without an answer"};
      } else if (isDown_) {
        reply.status = 503;
      } else {
        taken_.emplace_back(request.body.view());
      }
      return std::optional(std::move(reply));
    });
  }
  int badStatus_ = 500;
  std::string retryAfter_;
  bool isDown_ = true;
  size_t sentBad_ = 0;
  std::vector<std::string> taken_;
};

TEST_F(OutboxWithABadPost, HoldsNoOtherUp) {
  for (const int status : {500, 0}) {
    badStatus_ = status;
    isDown_ = true;
    taken_.clear();
    sentBad_ = 0;
    begin();
    for (const char* body : {"a", "bad", "b", "c", "d", "e", "f", "g"}) static_cast<void>(post(body));
    isDown_ = false;
    pass(minutes(1));
    EXPECT_EQ(taken_, std::vector<std::string>({"a", "b", "c", "d", "e", "f", "g"})) << status;
    EXPECT_EQ(disk_->posts.size(), 1U);
    pass(hours(24));
    EXPECT_LE(sentBad_, 60U) << "half an hour between two tries";
    EXPECT_EQ(outbox_->drop({}).posts, 1U);
    stop();
  }
}

TEST_F(OutboxWithABadPost, IsItselfLeftAloneForAsLongAsTheServerAsks) {
  begin();
  static_cast<void>(post("bad"));
  static_cast<void>(post("found the server well"));
  isDown_ = false;
  pass(minutes(1));
  ASSERT_EQ(outbox_->list().at(0).failingAlone, 1U);
  retryAfter_ = "40000";
  const size_t failed = sentBad_;
  while (sentBad_ == failed) pass(minutes(1));
  const size_t before = sentBad_;
  for (int i = 0; i < 10; ++i) {
    isDown_ = true;
    static_cast<void>(post(std::to_string(i)));
    isDown_ = false;
    pass(hours(1));
  }
  EXPECT_EQ(taken_.size(), 11U);
  EXPECT_EQ(sentBad_, before);
  pass(hours(2));
  EXPECT_GT(sentBad_, before);
}

TEST_F(OutboxWithABadPost, HoldsNoOtherUpHoweverManyItsServerDoesNotTake) {
  begin();
  for (int i = 0; i < 20; ++i) static_cast<void>(post("bad"));
  for (int i = 0; i < 20; ++i) static_cast<void>(post(std::to_string(i)));
  isDown_ = false;
  pass(hours(12));
  ASSERT_EQ(taken_.size(), 20U);
  EXPECT_TRUE(std::is_sorted(taken_.begin() + 1, taken_.end(), [](const auto& one, const auto& other) {
    return std::stoi(one) < std::stoi(other);
  }));
  const size_t before = sentBad_;
  static_cast<void>(post("kept a moment", 1000, std::string(kServer) + "/v1/late"));
  pass(hours(24));
  EXPECT_LE(sentBad_ - before, 20U * 60U);
}

TEST_F(OutboxWithABadPost, IsSentLessAndLessOftenToAServerThatTakesNewPosts) {
  begin();
  static_cast<void>(post("bad"));
  isDown_ = false;
  for (int second = 0; second < 7200; second += 2) {
    static_cast<void>(post("new"));
    pass(seconds(2));
  }
  EXPECT_LE(sentBad_, 20U);
  EXPECT_GE(sentBad_, 8U);
}

TEST_F(OutboxWithABadPost, IsSentLessAndLessOftenToAServerThatTakesANewPostNowAndThen) {
  begin();
  static_cast<void>(post("bad"));
  isDown_ = false;
  for (int minute = 0; minute < 1440; ++minute) {
    static_cast<void>(post("new"));
    pass(minutes(1));
  }
  EXPECT_LE(sentBad_, 90U);
}

TEST_F(OutboxWithABadPost, LeavesTheOthersTheirOrderAfterAnOutage) {
  begin();
  std::vector<std::string> sorted;
  for (int i = 0; i < 200; ++i) {
    static_cast<void>(post(std::to_string(1000 + i)));
    sorted.push_back(std::to_string(1000 + i));
    pass(minutes(7));
  }
  isDown_ = false;
  pass(hours(1));
  ASSERT_EQ(taken_.size(), sorted.size());
  sorted.erase(std::find(sorted.begin(), sorted.end(), taken_.front()));
  EXPECT_EQ(std::vector<std::string>(taken_.begin() + 1, taken_.end()), sorted)
      << "only the one that found the server well comes before its turn";
}

TEST_F(OutboxTest, LeavesRoomForNewPostsHoweverManyServersAreSilent) {
  start();
  constexpr size_t kServers = Limits::maxOutboxRequestsInFlight + 20;
  for (size_t i = 0; i < kServers; ++i)
    postAndKeep("x", 1000, "https://silent" + std::to_string(i) + ".example.org");
  pass(seconds(6));
  EXPECT_EQ(openBodies().size(), Limits::maxOutboxRequestsToSlowServers);
  pass(minutes(1));
  const size_t before = sent();
  fail(last(), 28);
  pass(seconds(0));
  EXPECT_EQ(sent(), before + 1) << "the next one's turn";
}

// Their names come before and behind the other's, so that no order of names helps it.
TEST_F(OutboxTest, KeepsNoServersRepeatsWaitingForServersThatAreSilent) {
  start();
  constexpr size_t kServers = 3 * Limits::maxOutboxRequestsInFlight;
  for (size_t i = 0; i < kServers; ++i)
    postAndKeep("silent", 1000,
                "https://" + std::string(i % 2 == 0 ? "a" : "z") + std::to_string(i) + ".org");
  pass(seconds(6));
  EXPECT_EQ(openBodies().size(), Limits::maxOutboxRequestsToSlowServers);
  for (int i = 0; i < 8; ++i) {
    static_cast<void>(post("good"));
    answer(last(), 503);
  }
  static_cast<void>(post("new"));
  answer(last(), 200);
  for (int i = 0; i < 10 && body(last()) != "good"; ++i) pass(seconds(1));
  ASSERT_EQ(openBodies().size(), Limits::maxOutboxRequestsToSlowServers + 1);
  for (int i = 0; i < 8; ++i)
    for (size_t request = sent(); request-- > 0;)
      if (network_->isOpen(request) && body(request) == "good") answer(request, 200);
  EXPECT_EQ(row().delivered, 2U * 9);
}

// They took four at a time, until none of them answered any more.
TEST_F(OutboxTest, KeepsNoServersRepeatsWaitingForManyThatFallSilentAtOnce) {
  start();
  constexpr size_t kServers = Limits::maxOutboxRequestsInFlight / Outbox::kMostAtATime;
  for (size_t i = 0; i < kServers; ++i)
    for (int number = 0; number < 8; ++number)
      postAndKeep("silent", 1000, "https://silent" + std::to_string(i) + ".example.org");
  pass(seconds(6));
  ASSERT_EQ(openBodies().size(), kServers);
  const size_t until = sent();
  for (size_t i = 0; i < until; ++i)
    if (network_->isOpen(i)) answer(i, 200);
  EXPECT_GT(openBodies().size(), 2 * kServers) << "more than one goes at a time";
  postAndKeep("good");
  pass(seconds(6));
  EXPECT_EQ(openBodies().back(), "good");
}

TEST_F(OutboxTest, LetsServersThatAreSilentTakeTurns) {
  start();
  constexpr size_t kServers = 2 * Limits::maxOutboxRequestsToSlowServers;
  for (size_t i = 0; i < kServers; ++i)
    postAndKeep(std::to_string(i), 1000, "https://silent" + std::to_string(i) + ".example.org");
  pass(seconds(6));
  std::set<std::string> tried;
  for (int round = 0; round < 2; ++round) {
    for (const std::string& one : openBodies()) tried.insert(one);
    pass(minutes(1));
    const size_t until = sent();
    for (size_t request = 0; request < until; ++request)
      if (network_->isOpen(request)) network_->fail(request, Error{kKYTURLErrorDomain, 28, "silent"});
    drain();
  }
  EXPECT_EQ(tried.size(), kServers);
}

TEST_F(OutboxTest, WaitsForARandomTimeUpToALimitThatDoublesUpToHalfAnHour) {
  start();
  waitLong();
  postAndKeep();
  std::vector<uint32_t> most;
  for (int failure = 0; failure < 12; ++failure) {
    const size_t before = sent();
    most.push_back(test_.random.bounds().back() - 1);
    test_.random.setDraw(most.back());
    pass(milliseconds(1800001));
    ASSERT_EQ(sent(), before + 1) << failure;
    fail(last());
  }
  EXPECT_EQ(most, std::vector<uint32_t>({5000, 10000, 20000, 40000, 80000, 160000, 320000, 640000, 1280000,
                                         1800000, 1800000, 1800000}));
}

TEST_F(OutboxTest, LeavesAServerAloneForAsLongAsItAsksButNoLongerThanADay) {
  start();
  static_cast<void>(post());
  answer(last(), 429, {{"Retry-After", "31536000"}});
  pass(hours(24) - seconds(1));
  EXPECT_EQ(sent(), 1U);
  pass(seconds(2));
  ASSERT_EQ(sent(), 2U);
  answer(last(), 503, {{"Retry-After", "7200"}});
  network_->changeConnectivity();
  pass(seconds(7190));
  EXPECT_EQ(sent(), 2U);
  pass(seconds(20));
  EXPECT_EQ(sent(), 3U);
}

TEST_F(OutboxTest, LeavesAServerAloneForAsLongAsItAsksThoughItTakesAnotherPost) {
  start();
  keepNumbered(9);
  pass(seconds(5));
  answer(last(), 200);
  ASSERT_EQ(openBodies().size(), 4U);
  const size_t first = last() - 3, before = sent();
  answer(first, 429, {{"Retry-After", "3600"}});
  answer(first + 1, 200);
  answer(first + 2, 404);
  answer(first + 3, 503);
  pass(seconds(3595));
  EXPECT_EQ(sent(), before);
  pass(seconds(10));
  EXPECT_GT(sent(), before);
}

TEST_F(OutboxTest, LeavesAServerAloneThatAsksForItInItsAnswerToANewPost) {
  start();
  postAndKeep("kept");
  pass(seconds(5));
  ASSERT_EQ(openBodies().size(), 1U);
  const size_t again = last();
  static_cast<void>(post("new"));
  answer(last(), 503, {{"Retry-After", "3600"}});
  answer(again, 200);
  const size_t before = sent();
  pass(seconds(3595));
  EXPECT_EQ(sent(), before);
  pass(seconds(10));
  EXPECT_GT(sent(), before);
}

// Each restart finds the clock further on, or back.
class OutboxOfABusyServer : public OutboxTest {
 protected:
  static constexpr int64_t kNow = 1767225600;
  // The server asked for that, once.
  void begin(const std::string& retryAfter) {
    start();
    static_cast<void>(post("kept"));
    answer(last(), 429, {{"Retry-After", retryAfter}});
    ASSERT_EQ(disk_->posts.size(), 1U);
  }
  void restartAt(int64_t time) {
    stop();
    test_.clock.setTimeOfDay({time, 0});
    start();
  }
  // Of the one server's line: until it is asked again.
  [[nodiscard]] Duration wait() const { return outbox_->list().at(0).untilNextTry; }
};

TEST_F(OutboxOfABusyServer, IsLeftAloneForAsLongAsItAskedOverARestart) {
  begin("7200");
  pass(minutes(10));
  restart();
  restart();
  pass(minutes(109));
  EXPECT_EQ(sent(), 0U) << "it asked for two hours";
  pass(minutes(3));
  EXPECT_EQ(openBodies(), std::vector<std::string>({"kept"}));
}

TEST_F(OutboxOfABusyServer, IsAskedAfterARestartThatCameLater) {
  begin("7200");
  restartAt(kNow + 7300);
  pass(seconds(6));
  EXPECT_EQ(openBodies(), std::vector<std::string>({"kept"}));
}

TEST_F(OutboxOfABusyServer, WaitsNoLongerThanItsTimeForAClockThatWasPutBack) {
  begin("7200");
  restartAt(kNow - 3LL * 365 * 86400);
  EXPECT_GE(wait(), hours(2));
  EXPECT_LE(wait(), hours(2) + minutes(1));
  pass(minutes(90));
  restart();
  EXPECT_LE(wait(), minutes(33)) << "it does not begin anew each time";
  pass(minutes(29));
  EXPECT_EQ(sent(), 0U);
  pass(minutes(5));
  EXPECT_EQ(openBodies(), std::vector<std::string>({"kept"}));
}

TEST_F(OutboxOfABusyServer, IsAskedInTimeThoughTheClockIsBehindAtEachStart) {
  begin("7200");
  for (int i = 1; i <= 2; ++i) {
    restartAt(kNow - 30 * 86400);
    pass(minutes(1));
    test_.clock.setTimeOfDay({kNow + i * 1800, 0});
    pass(minutes(31));
    EXPECT_LE(wait(), hours(2) - minutes(30 * i + 28));
    EXPECT_EQ(sent(), 0U);
  }
  pass(minutes(31));
  EXPECT_EQ(openBodies(), std::vector<std::string>({"kept"}));
}

TEST_F(OutboxOfABusyServer, WaitsNoLongerThanADayWhateverTheClockSays) {
  begin("31536000");
  restartAt(kNow - 86400);
  EXPECT_EQ(wait(), hours(24));
  restartAt(kNow + 10);
  EXPECT_LE(wait(), hours(24));
}

TEST_F(OutboxOfABusyServer, IsLeftAloneByAClockThatIsNotSetUntilItIs) {
  begin("7200");
  restartAt(100);
  pass(minutes(50));
  EXPECT_EQ(sent(), 0U);
  restartAt(200);
  EXPECT_GE(wait(), hours(2) - minutes(1));
  test_.clock.setTimeOfDay({kNow + 7100, 0});
  pass(minutes(30));
  EXPECT_LE(wait(), minutes(3));
  pass(minutes(3));
  EXPECT_EQ(openBodies(), std::vector<std::string>({"kept"}));
}

TEST_F(OutboxOfABusyServer, IsAskedOnceTheClockIsSetWhereItsTimeIsOver) {
  begin("7200");
  restartAt(100);
  test_.clock.setTimeOfDay({kNow + 86400, 0});
  pass(minutes(31));
  EXPECT_EQ(openBodies(), std::vector<std::string>({"kept"}));
  EXPECT_TRUE(disk_->pauses.empty());
}

TEST_F(OutboxOfABusyServer, IsLeftAloneThoughTheClockWasSetLater) {
  test_.clock.setTimeOfDay({100, 0});
  begin("7200");
  EXPECT_TRUE(disk_->pauses.empty());
  test_.clock.setTimeOfDay({kNow, 0});
  pass(minutes(31));
  restart();
  pass(minutes(80));
  EXPECT_EQ(sent(), 0U);
}

TEST_F(OutboxOfABusyServer, IsAskedWhereWhatTheDiskSaysCannotBe) {
  begin("7200");
  ASSERT_EQ(disk_->pauses.size(), 1U);
  constexpr int64_t kMost = std::numeric_limits<int64_t>::max(), kLeast = std::numeric_limits<int64_t>::min();
  const std::pair<int64_t, int64_t> wrong[] = {{kLeast, kMost},
                                               {kMost, kLeast},
                                               {0, 0},
                                               {-1, kNow + 60},
                                               {kNow, kMost},
                                               {kMost, kMost},
                                               {kNow, kNow + 2 * 86400},
                                               {kNow + 3600, kNow + 60},
                                               {kMost - 1, kMost}};
  for (const auto& [since, until] : wrong) {
    for (auto& [server, pause] : disk_->pauses) pause = {server, since, until};
    const auto before = disk_->pauses;
    restart();
    EXPECT_LE(wait(), seconds(5)) << since << " " << until;
    stop();
    disk_->pauses = before;
    start();
  }
  disk_->pauses[77] = {77, kNow, kNow + 3600};
  restart();
  EXPECT_FALSE(disk_->pauses.contains(77)) << "of nobody's";
}

TEST_F(OutboxOfABusyServer, IsLeftAloneNoMoreAfterARestartThatFollowedAFlush) {
  begin("7200");
  outbox_->flush();
  drain();
  ASSERT_EQ(openBodies().size(), 1U);
  answer(last(), 503);
  restart();
  EXPECT_LE(wait(), seconds(10));
  EXPECT_TRUE(disk_->pauses.empty());
}

TEST_F(OutboxOfABusyServer, IsForgottenWithItsLastPost) {
  begin("7200");
  EXPECT_EQ(disk_->pauses.size(), 1U);
  EXPECT_EQ(outbox_->drop({}).posts, 1U);
  EXPECT_TRUE(disk_->pauses.empty());
}

TEST_F(OutboxOfABusyServer, CostsTheDiskLittleHoweverOftenItAsks) {
  start();
  for (int second = 0; second < 300; ++second) {
    static_cast<void>(post());
    answer(last(), 429, {{"Retry-After", "3600"}});
    pass(seconds(1));
  }
  EXPECT_GE(disk_->pausesSet, 4U);
  EXPECT_LE(disk_->pausesSet, 6U);
  restart();
  EXPECT_GE(wait(), seconds(3598));
}

TEST_F(OutboxOfABusyServer, IsOneOfABoundedNumber) {
  start();
  for (size_t i = 0; i < Limits::maxOutboxPauses + 20; ++i) {
    static_cast<void>(post("x", 1000, "https://busy" + std::to_string(i) + ".example.org"));
    answer(last(), 429, {{"Retry-After", "3600"}});
  }
  EXPECT_EQ(disk_->pauses.size(), Limits::maxOutboxPauses);
}

TEST_F(OutboxOfABusyServer, KeepsNobodyWaitingWhereTheDiskDoesNotTakeThat) {
  start();
  disk_->problemOfPauses = PostStoreProblem{PostStoreProblem::Kind::unavailable, "disk full"};
  static_cast<void>(post("kept"));
  answer(last(), 429, {{"Retry-After", "7200"}});
  postAndKeep("another", 1000, "https://other.example.org/x");
  pass(seconds(6));
  EXPECT_EQ(openBodies(), std::vector<std::string>({"another"}));
  disk_->problemOfPauses.reset();
  pass(seconds(31));
  restart();
  pass(minutes(100));
  for (const std::string& open : openBodies()) EXPECT_NE(open, "kept");
}

TEST_F(OutboxTest, LosesOnlyThePostThatAServerRefusesForGood) {
  start();
  keepNumbered(3);
  pass(seconds(5));
  answer(last(), 413);
  EXPECT_EQ(openBodies(), std::vector<std::string>({"1"}));
  answer(last(), 302);
  EXPECT_EQ(openBodies(), std::vector<std::string>({"2"}));
  answer(last(), 501);
  EXPECT_TRUE(disk_->posts.empty());
  EXPECT_EQ(row().droppedFor(Reason::postRefused), 4U);
  EXPECT_EQ(row().droppedFor(Reason::postRedirected), 2U);
  EXPECT_EQ(row().outbox, 0U);
}

TEST_F(OutboxTest, HoldsTheLineBackWhenTheOperatorBrakes) {
  start();
  waitLong();
  keepNumbered(3);
  pass(seconds(6));
  answer(last(), 501);
  EXPECT_TRUE(openBodies().empty());
  pass(minutes(1));
  EXPECT_EQ(openBodies(), std::vector<std::string>({"1"}));
}

TEST_F(OutboxTest, LetsNoServerWaitForAnother) {
  start();
  postAndKeep("hangs", 1000, "https://hangs.example.org/v1");
  postAndKeep("good", 1000, "https://good.example.org/v1");
  postAndKeep("busy", 1000, "https://busy.example.org/v1");
  pass(seconds(5));
  EXPECT_EQ(openBodies(), std::vector<std::string>({"busy", "good", "hangs"}));
  for (size_t i = 0; i < sent(); ++i)
    if (network_->isOpen(i) && body(i) == "busy") answer(i, 429, {{"Retry-After", "100000"}});
  postAndKeep("good 2", 1000, "https://good.example.org/v1");
  for (size_t i = 0; i < sent(); ++i)
    if (network_->isOpen(i) && body(i) == "good") answer(i, 200);
  EXPECT_EQ(openBodies(), std::vector<std::string>({"hangs", "good 2"}));
}

TEST_F(OutboxTest, GoesOnAtOnceWhenConnectivityReturns) {
  start();
  waitLong();
  postAndKeep();
  for (int i = 0; i < 12; ++i) {
    pass(minutes(31));
    fail(last());
  }
  const size_t before = sent();
  pass(seconds(10));
  ASSERT_EQ(sent(), before);
  EXPECT_TRUE(network_->isWatched());
  network_->changeConnectivity();
  drain();
  ASSERT_EQ(sent(), before + 1);
  answer(last(), 200);
  EXPECT_FALSE(network_->isWatched());
}

TEST_F(OutboxTest, AsksNoServerMoreThanOnceInFiveSecondsHoweverOftenConnectivityReturns) {
  start();
  waitLong();
  postAndKeep();
  pass(seconds(6));
  for (int i = 0; i < 4; ++i) {
    pass(minutes(10));
    fail(last());
  }
  const size_t before = sent();
  for (int i = 0; i < 100; ++i) {
    network_->changeConnectivity();
    drain();
    if (network_->isOpen(last())) fail(last());
    pass(milliseconds(100));
  }
  EXPECT_LE(sent() - before, 3U);
}

TEST_F(OutboxTest, GoesOnWhenTheServerTakesANewPost) {
  start();
  waitLong();
  postAndKeep("old");
  for (int i = 0; i < 6; ++i) {
    pass(minutes(31));
    answer(last(), 503);
  }
  pass(seconds(6));
  static_cast<void>(post("new"));
  answer(last(), 200);
  EXPECT_EQ(openBodies(), std::vector<std::string>({"old"}));
}

TEST_F(OutboxTest, SendsPostsOfTwoIdentitiesThroughSessionsOfTheirOwn) {
  start();
  postAndKeep("a");
  URLRequest request = network_->lastRequest();
  request.identity = "another";
  request.events = std::make_shared<const BookedEvents>();
  session_->start(std::move(request), [](auto, auto, auto) {});
  fail(last());
  postAndKeep("c");
  pass(seconds(5));
  answer(last(), 200);
  ASSERT_EQ(sent(), 6U);
  EXPECT_NE(network_->sessionOf(3), network_->sessionOf(4));
  EXPECT_NE(network_->sessionOf(4), network_->sessionOf(5));
}

TEST_F(OutboxTest, LosesTheOldestOfAUserWhoseShareIsFull) {
  settings_.maxBytesPerUser = 3000;
  start();
  postAndKeep("other", 2000);
  for (int i = 0; i < 5; ++i) postAndKeep(std::string(900, static_cast<char>('a' + i)));
  EXPECT_EQ(disk_->posts.size(), 4U);
  EXPECT_EQ(row(1000).droppedFor(Reason::outboxDisplaced), 4U);
  EXPECT_EQ(row(1000).outbox, 6U);
  EXPECT_EQ(row(2000).outbox, 2U);
  EXPECT_EQ(disk_->posts.rbegin()->second.body.view().front(), 'e');
}

TEST_F(OutboxTest, LosesTheOldestOfAllWhenItIsFull) {
  settings_.maxBytes = 3000;
  start();
  for (uint32_t i = 0; i < 5; ++i) postAndKeep(std::string(900, 'x'), 1000 + i);
  EXPECT_EQ(row(1000).droppedFor(Reason::outboxDisplaced), 2U);
  EXPECT_EQ(row(1001).droppedFor(Reason::outboxDisplaced), 2U);
  EXPECT_EQ(row(1004).outbox, 2U);
}

TEST_F(OutboxTest, DisplacesNothingForAPostThatTheDiskDoesNotTake) {
  settings_.maxBytes = 3000;
  start();
  for (uint32_t i = 0; i < 3; ++i) postAndKeep(std::string(900, 'x'), 1000 + i);
  disk_->problem = PostStoreProblem{PostStoreProblem::Kind::unavailable, "disk full"};
  const auto outcome = post(std::string(900, 'x'), 1003);
  answer(last(), 503);
  EXPECT_EQ(outcome->response->status, 503);
  disk_->problem.reset();
  EXPECT_EQ(disk_->posts.size(), 3U);
  EXPECT_EQ(row(1000).outbox, 2U);
  pass(minutes(31));
  EXPECT_EQ(openBodies().size(), 1U);
}

TEST_F(OutboxTest, LosesWhatItsBoundsAllowNoMoreAtTheStart) {
  start();
  for (uint32_t i = 0; i < 6; ++i) postAndKeep(std::string(900, 'x'), 1000 + i % 2);
  stop();
  settings_.maxBytes = 3000;
  settings_.maxBytesPerUser = 1000;
  start();
  EXPECT_EQ(disk_->posts.size(), 2U);
  EXPECT_TRUE(disk_->posts.contains(5) && disk_->posts.contains(6));
  EXPECT_EQ(row(1000).droppedFor(Reason::outboxDisplaced), 4U);
}

TEST_F(OutboxTest, LosesNothingForAPostThatFindsNoRoomAfterAll) {
  settings_.maxBytes = 3000;
  settings_.maxBytesPerUser = 3000;
  start();
  postAndKeep(std::string(300, 'a'));
  postAndKeep(std::string(2000, 'b'));
  pass(seconds(6));
  const size_t again = last();
  EXPECT_EQ(body(again).front(), 'a') << "on its way, so it is not displaced";
  answer(again, 200);
  ASSERT_EQ(body(last()).front(), 'b');
  postAndKeep(std::string(300, 'c'));
  const auto outcome = post(std::string(2600, 'd'));
  answer(last(), 503);
  EXPECT_TRUE(outcome->response) << "it finds no room beside what is on its way";
  EXPECT_EQ(disk_->posts.size(), 2U);
  EXPECT_EQ(row().droppedFor(Reason::outboxDisplaced), 0U);
}

TEST_F(OutboxTest, IsNotEmptyOnceASessionIsToldThatAPostIsKept) {
  start();
  bool wasEmpty = true, isTold = false;
  FailedPost failed;
  failed.post.url = kServer;
  outbox_->keep(std::move(failed), [&](bool) {
    isTold = true;
    wasEmpty = outbox_->isEmpty();
  });
  drain();
  EXPECT_TRUE(isTold);
  EXPECT_FALSE(wasEmpty);
}

TEST_F(OutboxTest, LetsNoUserFillItWithSmallPosts) {
  start();
  postAndKeep("another user's", 2000);
  for (size_t i = 0; i < Limits::maxOutboxPostsOfAUser + 100; ++i) {
    FailedPost failed;
    failed.post.user = 1000;
    failed.post.url = kServer;
    outbox_->keep(std::move(failed), [](bool isKept) { EXPECT_TRUE(isKept); });
    if (i % 64 == 0) drain();
  }
  drain();
  EXPECT_EQ(disk_->posts.size(), Limits::maxOutboxPostsOfAUser + 1);
  EXPECT_EQ(row(2000).outbox, 2U);
}

TEST_F(OutboxTest, DropsAlsoWhatItHadNotReadYet) {
  start();
  postAndKeep("kept");
  stop();
  disk_->problem = PostStoreProblem{PostStoreProblem::Kind::unavailable, "not mounted"};
  start();
  disk_->problem.reset();
  test_.clock.advance(Outbox::kDiskPause);
  EXPECT_EQ(outbox_->drop({}).posts, 1U);
  EXPECT_TRUE(disk_->posts.empty());
}

TEST_F(OutboxTest, KeepsNoPostLargerThanItsBounds) {
  settings_.maxBytesPerUser = 3000;
  start();
  const auto outcome = post(std::string(3000, 'x'));
  answer(last(), 503);
  EXPECT_EQ(outcome->response->status, 503);
  EXPECT_EQ(test_.counters.value(Reason::postNotKept), 1U);
}

TEST_F(OutboxTest, LosesWhatNobodyTookInTime) {
  start();
  postAndKeep("old");
  for (int day = 0; day < 13; ++day) {
    pass(hours(24));
    if (network_->isOpen(last())) fail(last());
  }
  postAndKeep("young");
  pass(hours(25));
  EXPECT_EQ(row().droppedFor(Reason::outboxTooOld), 2U);
  EXPECT_EQ(disk_->posts.size(), 1U);
}

TEST_F(OutboxTest, CountsAgeOverARestartAndMakesNothingOldByAClockThatJumps) {
  start();
  postAndKeep("first");
  stop();
  test_.clock.setTimeOfDay({1767225600 + 13 * 86400, 0});
  start();
  EXPECT_EQ(row().outbox, 2U);
  stop();
  test_.clock.setTimeOfDay({1767225600 + 15 * 86400, 0});
  start();
  EXPECT_EQ(row().outbox, 2U);
  pass(minutes(95));
  EXPECT_EQ(row().droppedFor(Reason::outboxTooOld), 2U);
  EXPECT_TRUE(disk_->posts.empty());
  test_.clock.setTimeOfDay({100, 0});
  postAndKeep("while the clock was not set");
  test_.clock.setTimeOfDay({1767225600, 0});
  pass(seconds(1));
  EXPECT_EQ(disk_->posts.size(), 1U);
  restart();
  EXPECT_EQ(disk_->posts.size(), 1U);
}

TEST_F(OutboxTest, DeletesNothingByAClockThatIsWrongForAMoment) {
  start();
  postAndKeep("first");
  stop();
  test_.clock.setTimeOfDay({4102444800, 0});  // 2100
  start();
  pass(minutes(50));
  EXPECT_EQ(row().outbox, 2U);
  test_.clock.setTimeOfDay({1767225600 + 86400, 0});
  pass(hours(3));
  EXPECT_EQ(row().outbox, 2U);
  test_.clock.setTimeOfDay({4102444800, 0});
  pass(hours(3));
  EXPECT_EQ(row().outbox, 2U) << "while the daemon runs ages do not go by that clock";
  restart();
  pass(minutes(50));
  EXPECT_EQ(row().outbox, 2U);
  restart();
  pass(minutes(31));
  EXPECT_TRUE(disk_->posts.empty()) << "it has said so for an hour, over a restart";
}

TEST_F(OutboxTest, LetsWhatWasKeptBeforeTheClockWasSetGrowOldFromThenOn) {
  test_.clock.setTimeOfDay({100, 0});
  start();
  postAndKeep("first");
  stop();
  test_.clock.setTimeOfDay({200, 0});
  start();
  test_.clock.setTimeOfDay({1767225600, 0});
  pass(hours(1));
  EXPECT_GE(disk_->posts.at(1).keptAt, 1767225600);
  test_.clock.setTimeOfDay({1767225600 - 30 * 86400, 0});
  postAndKeep("by a clock that lags");
  for (int day = 0; day < 16; ++day) {
    stop();
    test_.clock.setTimeOfDay({1767225600 + day * 86400, 0});
    start();
    pass(hours(2));
  }
  EXPECT_TRUE(disk_->posts.empty()) << "each start does not make it new";
}

TEST_F(OutboxTest, LetsAPostGrowOldThatLiesAheadOfTheClock) {
  test_.clock.setTimeOfDay({4102444800, 0});
  start();
  postAndKeep("first");
  for (int day = 0; day < 16; ++day) {
    stop();
    test_.clock.setTimeOfDay({1767225600 + day * 86400, 0});
    start();
    pass(hours(2));
  }
  EXPECT_TRUE(disk_->posts.empty());
}

TEST_F(OutboxTest, LosesAnOldPostThatLiesBehindAYoungOne) {
  start();
  postAndKeep("young by its clock");
  test_.clock.setTimeOfDay({1767225600 - 13 * 86400, 0});
  postAndKeep("old by its clock");
  stop();
  test_.clock.setTimeOfDay({1767225600, 0});
  start();
  pass(hours(48));
  ASSERT_EQ(disk_->posts.size(), 1U);
  EXPECT_EQ(disk_->posts.begin()->second.body.view(), "young by its clock");
}

TEST_F(OutboxTest, CountsTheTimeThatTheMachineSleeps) {
  start();
  postAndKeep("first");
  test_.clock.sleep(hours(24 * 15));
  pass(hours(1));
  EXPECT_TRUE(disk_->posts.empty());
}

TEST_F(OutboxTest, KeepsADamagedFileNoLongerThanAPost) {
  disk_->isSetAside = true;
  disk_->setAsideAt = 1767225600 - 15 * 86400;
  start();
  EXPECT_FALSE(disk_->isSetAside);
  disk_->isSetAside = true;
  disk_->setAsideAt = 1767225600 - 13 * 86400;
  restart();
  EXPECT_TRUE(disk_->isSetAside);
}

TEST_F(OutboxTest, BooksWhatLayInItAtTheStart) {
  start();
  postAndKeep("a", 1000);
  postAndKeep("b", 2000);
  restart();
  EXPECT_EQ(row(1000).taken, 2U);
  EXPECT_EQ(row(1000).outbox, 2U);
  EXPECT_EQ(row(2000).outbox, 2U);
  EXPECT_EQ(row(1000).program, (ReportingProgram{1000, 7, "videocall", "call"}));
  pass(seconds(5));
  answer(last(), 200);
  EXPECT_EQ(row(1000).delivered, 2U);
  EXPECT_EQ(row(1000).outbox, 0U);
}

TEST_F(OutboxTest, DeletesWhatWasCollectedByConsentBeforeAnythingElseLeaves) {
  start();
  isByConsent_ = true;
  keepNumbered(2);
  isByConsent_ = false;
  postAndKeep("without");
  const size_t before = sent();
  test_.consent.setAllowed(false);
  pass(seconds(5));
  EXPECT_EQ(openBodies(), std::vector<std::string>({"without"}));
  EXPECT_EQ(sent(), before + 1);
  EXPECT_TRUE(disk_->posts.size() == 1);
  EXPECT_EQ(row().droppedFor(Reason::outboxConsentWithdrawn), 4U);
}

TEST_F(OutboxTest, DeletesWhatWasCollectedByAConsentThatWentWhileTheDaemonDidNotRun) {
  start();
  isByConsent_ = true;
  postAndKeep("by consent");
  stop();
  test_.consent.setAllowed(false);
  start();
  EXPECT_TRUE(disk_->posts.empty());
  EXPECT_TRUE(disk_->wasForGood);
  EXPECT_EQ(row().droppedFor(Reason::outboxConsentWithdrawn), 2U);
  pass(hours(1));
  EXPECT_EQ(sent(), 0U);
}

TEST_F(OutboxTest, DeletesAtOnceWhenTheConsentGoes) {
  start();
  isByConsent_ = true;
  postAndKeep("by consent");
  test_.consent.setAllowed(false);
  outbox_->consentMayHaveChanged();
  drain();
  EXPECT_TRUE(disk_->posts.empty());
  EXPECT_TRUE(disk_->wasForGood);
}

TEST_F(OutboxTest, DeletesWhatWasCollectedBeforeTheConsentWasWithdrawnAndGivenAgain) {
  for (const bool runs : {true, false}) {
    start();
    isByConsent_ = true;
    postAndKeep("by the first");
    postAndKeep("by the first, too");
    if (!runs) stop();
    test_.consent.setAllowed(false);
    test_.consent.setAllowed(true);
    if (!runs) start();
    pass(Outbox::kLongestRest);
    EXPECT_TRUE(disk_->posts.empty()) << runs;
    postAndKeep("by the second");
    restart();
    EXPECT_EQ(disk_->posts.size(), 1U) << runs;
    EXPECT_EQ(outbox_->drop({}).posts, 1U);
    stop();
  }
}

TEST_F(OutboxTest, DeletesAfterARestartWhatTheDiskWouldNotLetGo) {
  start();
  isByConsent_ = true;
  postAndKeep("by the first");
  test_.consent.setAllowed(false);
  disk_->problem = PostStoreProblem{PostStoreProblem::Kind::unavailable, "read only"};
  pass(Outbox::kLongestRest);
  stop();
  disk_->problem.reset();
  test_.consent.setAllowed(true);
  ASSERT_EQ(disk_->posts.size(), 1U);
  start();
  pass(hours(1));
  EXPECT_TRUE(disk_->posts.empty());
  EXPECT_EQ(sent(), 0U);
}

TEST_F(OutboxTest, TriesAgainToRemoveADamagedFileWhenTheConsentGoes) {
  disk_->isSetAside = disk_->keepsSetAside = true;
  start();
  test_.consent.setAllowed(false);
  outbox_->consentMayHaveChanged();
  drain();
  disk_->keepsSetAside = false;
  pass(Outbox::kLongestRest);
  EXPECT_FALSE(disk_->isSetAside);
}

TEST_F(OutboxTest, CancelsWhatIsOnItsWayWhenTheConsentGoes) {
  start();
  isByConsent_ = true;
  postAndKeep("by consent");
  pass(seconds(5));
  ASSERT_EQ(openBodies().size(), 1U);
  test_.consent.setAllowed(false);
  pass(Outbox::kLongestRest);
  EXPECT_TRUE(openBodies().empty());
  EXPECT_TRUE(disk_->posts.empty());
  EXPECT_TRUE(outbox_->isEmpty());
}

TEST_F(OutboxTest, KeepsNothingThatWasCollectedByAConsentThatIsGone) {
  start();
  isByConsent_ = true;
  const auto outcome = post();
  test_.consent.setAllowed(false);
  answer(last(), 503);
  EXPECT_EQ(outcome->response->status, 503);
  EXPECT_TRUE(disk_->posts.empty());
}

TEST_F(OutboxTest, SetsADamagedFileAsideAndGoesOn) {
  start();
  postAndKeep("lost");
  disk_->problem = PostStoreProblem{PostStoreProblem::Kind::damaged, "malformed"};
  pass(seconds(5));
  EXPECT_EQ(disk_->setAside, 1U);
  EXPECT_EQ(test_.counters.value(Reason::outboxFileDamaged), 1U);
  EXPECT_EQ(row().droppedFor(Reason::outboxUnreadable), 2U);
  postAndKeep("kept");
  EXPECT_EQ(disk_->posts.size(), 1U);
  EXPECT_EQ(row().outbox, 2U);
}

TEST_F(OutboxTest, KeepsNoDamagedFileOfWhichPartsMayBeOfAConsentThatIsGone) {
  start();
  postAndKeep("lost");
  disk_->problem = PostStoreProblem{PostStoreProblem::Kind::damaged, "malformed"};
  pass(seconds(5));
  EXPECT_TRUE(disk_->isSetAside);
  test_.consent.setAllowed(false);
  postAndKeep("without consent");
  EXPECT_FALSE(disk_->isSetAside);
  disk_->problem = PostStoreProblem{PostStoreProblem::Kind::damaged, "malformed"};
  pass(seconds(6));
  EXPECT_EQ(disk_->setAside, 2U);
  EXPECT_FALSE(disk_->isSetAside);
}

TEST_F(OutboxTest, SaysOfNoPostThatItIsNotKeptBecauseAnotherCouldNotBeOverwritten) {
  start();
  isByConsent_ = true;
  postAndKeep("by consent");
  isByConsent_ = false;
  const auto outcome = post("without");
  test_.consent.setAllowed(false);
  disk_->problemForGood = PostStoreProblem{PostStoreProblem::Kind::unavailable, "cannot cut its log short"};
  answer(last(), 503);
  EXPECT_EQ(outcome->response.has_value(), disk_->posts.empty());
  EXPECT_EQ(row().outbox, disk_->posts.size() * 2);
}

std::vector<std::string> fatesOf(Watcher& watcher) {
  std::vector<std::string> fates;
  while (const auto event = watcher.next()) {
    std::string fate = event->dropped ? reasonName(*event->dropped) : event->isKept ? "kept" : "delivered";
    fate += " " + std::to_string(event->kind.category) + " " + event->backEnd;
    if (event->post) fate += " " + event->post->server() + " " + std::to_string(event->post->status());
    fates.push_back(std::move(fate));
  }
  return fates;
}

TEST_F(OutboxTest, ShowsWatchersThatAPostIsKeptAndItsEnd) {
  start();
  const auto watcher = books_->watchers()->watch({});
  isShown_ = true;
  static_cast<void>(post("body"));
  answer(last(), 503);
  const std::string kept = "kept 9 httppost https://events.example.org 503";
  EXPECT_EQ(fatesOf(*watcher), std::vector<std::string>({kept, kept}));
  pass(seconds(6));
  answer(last(), 200);
  const std::string end = "delivered 9 httppost https://events.example.org 200";
  EXPECT_EQ(fatesOf(*watcher), std::vector<std::string>({end, end}));
}

TEST_F(OutboxTest, ShowsWatchersTheEndOfWhatWasKeptBeforeTheyCame) {
  start();
  postAndKeep("body");
  const auto watcher = books_->watchers()->watch({});
  EXPECT_EQ(outbox_->drop({}).posts, 1U);
  EXPECT_EQ(fatesOf(*watcher),
            std::vector<std::string>({"outbox-dropped -1 httppost", "outbox-dropped -1 httppost"}));
}

TEST_F(OutboxTest, LosesOnlyThePostThatCannotBeRead) {
  start();
  keepNumbered(2);
  disk_->posts.erase(disk_->posts.begin());
  pass(seconds(10));
  EXPECT_EQ(openBodies(), std::vector<std::string>({"1"}));
  answer(last(), 200);
  EXPECT_EQ(row().outbox, 0U);
  EXPECT_EQ(row().droppedFor(Reason::outboxUnreadable), 2U);
  EXPECT_EQ(row().delivered, 2U);
}

TEST_F(OutboxTest, GoesOnWithTheOthersWhereTheDiskDoesNotGiveOne) {
  start();
  waitLong();
  keepNumbered(4);
  postAndKeep("another server's", 1000, "https://another.example.org/v1");
  disk_->unreadable = {1, 3};
  pass(seconds(6));
  EXPECT_EQ(openBodies(), std::vector<std::string>({"another server's", "1"}));
  answer(last(), 200);
  EXPECT_EQ(openBodies(), std::vector<std::string>({"another server's", "3"}));
  const auto outcome = post("new");
  answer(last(), 503);
  EXPECT_FALSE(outcome->response) << "it is kept";
  EXPECT_EQ(row().droppedFor(Reason::outboxUnreadable), 0U) << "the disk may give it another time";
  for (int i = 0; i < 20; ++i) {
    pass(minutes(10));
    postAndKeep("x", 1000, "https://another.example.org/v1");
  }
  EXPECT_EQ(row().droppedFor(Reason::outboxUnreadable), 4U) << "once for each";
  EXPECT_EQ(row().outbox, disk_->posts.size() * 2);
  EXPECT_FALSE(disk_->posts.contains(1) || disk_->posts.contains(3));
}

TEST_F(OutboxTest, LosesNothingToADiskThatGivesNothingForHours) {
  start();
  keepNumbered(20);
  disk_->readsFail = true;
  pass(hours(12));
  EXPECT_TRUE(openBodies().empty());
  EXPECT_EQ(row().outbox, 40U);
  disk_->readsFail = false;
  network_->setResponder([](const URLRequest&) { return std::optional(FakeURLSessionFactory::Reply()); });
  pass(hours(1));
  EXPECT_EQ(row().delivered, 40U);
}

TEST_F(OutboxTest, BooksNothingTwiceWhereTheDiskFailsAsItReadsItsFile) {
  start();
  keepNumbered(3);
  stop();
  disk_->readableHeads = 2;
  start();
  pass(minutes(10));
  EXPECT_EQ(row().taken, 0U);
  EXPECT_EQ(test_.counters.value(Reason::outboxUnreadable), 0U);
  disk_->readableHeads.reset();
  pass(Outbox::kDiskPause);
  EXPECT_EQ(row().taken, 6U);
  EXPECT_EQ(row().outbox, 6U);
}

TEST_F(OutboxTest, ReadsItsFileLaterWhenTheDiskDoesNotAnswerAtTheStart) {
  start();
  postAndKeep("kept");
  stop();
  disk_->problem = PostStoreProblem{PostStoreProblem::Kind::unavailable, "not mounted"};
  start();
  EXPECT_TRUE(outbox_->isEmpty());
  disk_->problem.reset();
  pass(Outbox::kDiskPause + seconds(6));
  EXPECT_EQ(openBodies(), std::vector<std::string>({"kept"}));
}

TEST_F(OutboxTest, SendsNothingMoreWhileTheDiskCannotForgetWhatWasTaken) {
  start();
  keepNumbered(2);
  pass(seconds(5));
  disk_->problem = PostStoreProblem{PostStoreProblem::Kind::unavailable, "read only"};
  answer(last(), 200);
  EXPECT_TRUE(openBodies().empty());
  disk_->problem.reset();
  pass(Outbox::kDiskPause);
  EXPECT_EQ(openBodies(), std::vector<std::string>({"1"}));
  EXPECT_EQ(disk_->posts.size(), 1U);
}

TEST_F(OutboxTest, TakesNoMoreThanFitsInMemoryWhileTheDiskIsSlow) {
  start();
  std::vector<std::shared_ptr<Outcome>> outcomes;
  for (uint32_t i = 0; i < 10; ++i) outcomes.push_back(post(std::string(1 << 20, 'x'), 1000 + i));
  for (size_t i = 0; i < outcomes.size(); ++i) network_->complete(i, 503);
  drain();
  size_t kept = 0;
  for (const auto& outcome : outcomes) kept += outcome->response ? 0 : 1;
  EXPECT_EQ(kept, (Limits::maxBytesOnTheWayToTheOutbox >> 20) - 1);
  EXPECT_EQ(test_.counters.value(Reason::postNotKept), outcomes.size() - kept);
}

TEST_F(OutboxTest, LeavesOthersRoomOnTheWayWhateverOneUserHasThere) {
  start();
  std::vector<std::shared_ptr<Outcome>> outcomes;
  for (int i = 0; i < 10; ++i) outcomes.push_back(post(std::string(1 << 20, 'x'), 1000));
  const auto ofAnother = post(std::string(1 << 20, 'x'), 2000);
  const auto large = post(std::string(3 << 20, 'x'), 3000);
  for (size_t i = 0; i < outcomes.size() + 2; ++i) network_->complete(i, 503);
  drain();
  size_t kept = 0;
  for (const auto& outcome : outcomes) kept += outcome->response ? 0 : 1;
  EXPECT_EQ(kept, (Limits::maxBytesOfAUserOnTheWayToTheOutbox >> 20) - 1);
  EXPECT_FALSE(ofAnother->response);
  EXPECT_FALSE(large->response) << "one has room in any case";
}

TEST_F(OutboxTest, PutsWhatFailsTogetherOnTheDiskTogether) {
  start();
  for (int i = 0; i < 50; ++i) static_cast<void>(post(std::to_string(i)));
  for (size_t i = 0; i < 50; ++i) network_->complete(i, 503);
  drain();
  EXPECT_EQ(disk_->posts.size(), 50U);
  EXPECT_LE(disk_->changes, 2U);
}

TEST_F(OutboxTest, ListsSendsAndDropsForTheAdministrator) {
  start();
  waitLong();
  postAndKeep("a", 1000, "https://one.example.org/x");
  postAndKeep("b", 2000, "https://two.example.org/x");
  pass(seconds(1));
  const auto servers = outbox_->list();
  ASSERT_EQ(servers.size(), 2U);
  EXPECT_EQ(servers[0].server, "https://one.example.org");
  EXPECT_EQ(servers[0].posts, 1U);
  EXPECT_EQ(servers[0].oldest, seconds(1));
  EXPECT_GT(servers[0].untilNextTry, Duration(0));
  EXPECT_EQ(outbox_->drop({.server = std::nullopt, .user = 1000}).posts, 1U);
  drain();
  EXPECT_EQ(row(1000).droppedFor(Reason::outboxDropped), 2U);
  outbox_->flush();
  drain();
  EXPECT_EQ(openBodies(), std::vector<std::string>({"b"}));
  EXPECT_EQ(outbox_->drop({}).posts, 1U);
  EXPECT_TRUE(outbox_->list().empty());
}

TEST_F(OutboxTest, SaysThatTheDiskDoesNotLetGoOfWhatIsDropped) {
  start();
  waitLong();
  postAndKeep("a");
  postAndKeep("b");
  disk_->problem = PostStoreProblem{PostStoreProblem::Kind::unavailable, "read only"};
  const Outbox::Dropped dropped = outbox_->drop({});
  EXPECT_EQ(dropped.posts, 2U);
  ASSERT_NE(dropped.problem, nullptr);
  EXPECT_NE(std::string(dropped.problem).find("let them go"), std::string::npos);
  EXPECT_EQ(disk_->posts.size(), 2U);
  disk_->problem.reset();
  pass(Outbox::kDiskPause);
  EXPECT_TRUE(disk_->posts.empty()) << "it is asked again";
  EXPECT_EQ(outbox_->drop({}).problem, nullptr);
}

TEST_F(OutboxTest, SaysThatNothingIsDroppedOfWhatTheDiskDoesNotShow) {
  start();
  postAndKeep("a");
  stop();
  disk_->problem = PostStoreProblem{PostStoreProblem::Kind::unavailable, "not there"};
  start();
  const Outbox::Dropped dropped = outbox_->drop({});
  EXPECT_EQ(dropped.posts, 0U);
  EXPECT_NE(dropped.problem, nullptr);
}

TEST_F(OutboxTest, TellsTheOwnerOfEachTimeThatAPostMayHaveLeft) {
  start();
  postAndKeep();
  EXPECT_TRUE(test_.departures.all().empty()) << "nobody listened";
  pass(seconds(5));
  fail(last(), 28);
  ASSERT_EQ(test_.departures.all().size(), 1U);
  EXPECT_FALSE(test_.departures.all()[0].isAnswered);
  pass(seconds(10));
  answer(last(), 200);
  ASSERT_EQ(test_.departures.all().size(), 2U);
  const Departure departure = test_.departures.all()[1];
  EXPECT_TRUE(departure.isAnswered);
  EXPECT_EQ(departure.program, (ReportingProgram{1000, 7, "videocall", "call"}));
  EXPECT_EQ(departure.server, kServer);
  EXPECT_EQ(departure.events, 2U);
  EXPECT_EQ(departure.bytes, 4U);
}

TEST_F(OutboxTest, StopsSendingButGoesOnKeepingAtTheEnd) {
  start();
  postAndKeep("a");
  pass(seconds(5));
  ASSERT_EQ(openBodies().size(), 1U);
  outbox_->stopSending();
  drain();
  EXPECT_TRUE(openBodies().empty());
  postAndKeep("b");
  pass(hours(1));
  EXPECT_TRUE(openBodies().empty());
  EXPECT_EQ(disk_->posts.size(), 2U);
}

// A week without the server, 100,000 posts, a restart each day.
TEST_F(OutboxTest, DeliversAWeeksOutageInOrderAndOnce) {
  constexpr int kPosts = 100000, kDays = 7;
  waitLong();
  start();
  std::vector<std::string> taken;
  bool isUp = false;
  const auto respond = [&](const URLRequest& request) -> std::optional<FakeURLSessionFactory::Reply> {
    FakeURLSessionFactory::Reply reply;
    if (!isUp) {
      reply.error = Error{kKYTURLErrorDomain, 7, "unreachable"};
      return reply;
    }
    taken.emplace_back(request.body.view());
    return reply;
  };
  int number = 0;
  for (int day = 0; day < kDays; ++day) {
    network_->setResponder(respond);
    for (int hour = 0; hour < 24; ++hour) {
      while (number < kPosts * (day * 24 + hour + 1) / (kDays * 24)) {
        static_cast<void>(post(std::to_string(number), 1000, "", 1));
        ++number;
      }
      pass(hours(1));
    }
    if (day + 1 < kDays) {
      restart();
      EXPECT_EQ(row().outbox, static_cast<uint64_t>(number));
    }
  }
  ASSERT_EQ(disk_->posts.size(), static_cast<size_t>(kPosts));
  isUp = true;
  pass(hours(1));
  ASSERT_EQ(taken.size(), static_cast<size_t>(kPosts));
  for (int i = 0; i < kPosts; ++i) ASSERT_EQ(taken[static_cast<size_t>(i)], std::to_string(i));
  EXPECT_TRUE(disk_->posts.empty());
  EXPECT_EQ(row().delivered, static_cast<uint64_t>(kPosts));
  EXPECT_EQ(row().outbox, 0U);
}

}  // namespace
}  // namespace kyt
