#include "platform/linux/url/RequestLines.h"

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <vector>

#include "platform/base/UserBudget.h"
#include "platform/fake/MemoryLogSink.h"
#include "platform/linux/url/URLNetwork.h"
#include "platform/linux/url/URLSessionState.h"
#include "tests/linux/url/CurlURLSessionFixture.h"

namespace kyt {
namespace {

constexpr uint32_t kAnn = 1001, kBob = 1002, kCat = 1003;

// The requests are real, but nothing is sent: no command reaches the network, so its thread never starts.
class RequestLinesTest : public testing::Test {
 protected:
  explicit RequestLinesTest(size_t most = 1, size_t mostToOneServer = 1) : lines_(most, mostToOneServer) {}
  ~RequestLinesTest() override {
    for (const auto& transfer : transfers_) transfer->self = nullptr;
  }
  // Puts it in line unless it may go.
  bool starts(const std::string& url, uint32_t user, size_t bodyBytes = 0) {
    URLRequest request;
    request.url = url;
    if (bodyBytes > 0) request.body = Data(std::string(bodyBytes, 'x'));
    request.account = budget_.account(user);
    auto& account = session_->outstanding.user(request.account);
    auto made = std::make_shared<URLTransfer>(session_, account, std::move(request), nullptr,
                                              URLTransfer::Refusal::none);
    made->self = made;
    transfers_.push_back(made);
    const bool goes = lines_.mayGo(*made);
    made->phase = goes ? URLTransfer::Phase::active : URLTransfer::Phase::inLine;
    return goes;
  }
  // Ends the last one that went, and the ones that go then, one after the other: the paths of all these.
  std::string rest() {
    std::string names;
    std::shared_ptr<URLTransfer> active = transfers_.front();
    for (;;) {
      lines_.hasGone(*active);
      active->phase = URLTransfer::Phase::done;
      active = lines_.next();
      if (active == nullptr) return names;
      names += active->request.url.substr(active->request.url.rfind('/') + 1);
    }
  }

  MemoryLogSink sink_;
  Log log_{sink_, LogLevel::debug};
  Counters counters_;
  UserBudget budget_{UserShares::of(Limits(), uint64_t{16} << 30, 4096)};
  const std::shared_ptr<URLNetwork> network_ =
      std::make_shared<URLNetwork>(CurlURLSessionOptions(), log_, counters_);
  const std::shared_ptr<URLSessionState> session_ =
      std::make_shared<URLSessionState>(network_, URLSessionConfiguration());
  std::vector<std::shared_ptr<URLTransfer>> transfers_;
  RequestLines lines_;
};

TEST_F(RequestLinesTest, LetUsersTakeTurns) {
  ASSERT_TRUE(starts("http://one/0", kAnn));
  for (const char* name : {"1", "2", "3", "4"}) ASSERT_FALSE(starts(std::string("http://one/") + name, kAnn));
  for (const char* name : {"a", "b"}) ASSERT_FALSE(starts(std::string("http://one/") + name, kBob));
  ASSERT_FALSE(starts("http://one/x", kCat));
  EXPECT_EQ(rest(), "1ax2b34");
}

TEST_F(RequestLinesTest, KeepTheOrderOfEachUser) {
  ASSERT_TRUE(starts("http://one/0", kAnn));
  for (const char* name : {"1", "2", "3"}) ASSERT_FALSE(starts(std::string("http://one/") + name, kAnn));
  EXPECT_EQ(rest(), "123");
}

// A user who starts requests without end took each place that became free before those in line.
TEST_F(RequestLinesTest, LetNobodyPassThoseInLine) {
  ASSERT_TRUE(starts("http://one/0", kAnn));
  ASSERT_FALSE(starts("http://one/b", kBob));
  lines_.hasGone(*transfers_.front());
  EXPECT_FALSE(starts("http://one/1", kAnn));
  const std::shared_ptr<URLTransfer> next = lines_.next();
  ASSERT_NE(next, nullptr);
  EXPECT_EQ(next->request.url, "http://one/b");
  EXPECT_EQ(lines_.next(), nullptr) << "it is counted";
}

TEST_F(RequestLinesTest, GiveBackAtOnceThePlaceOfOneThatGoesAnew) {
  ASSERT_TRUE(starts("http://one/0", kAnn));
  ASSERT_FALSE(starts("http://one/b", kBob));
  lines_.hasGone(*transfers_.front());
  lines_.goesAgain(*transfers_.front());
  EXPECT_EQ(lines_.next(), nullptr);
  EXPECT_EQ(rest(), "b");
}

// The first by its name was always next.
TEST_F(RequestLinesTest, LetServersWithAsManyOnTheirWayTakeTurns) {
  ASSERT_TRUE(starts("http://a/0", kAnn));
  for (const char* name : {"1", "2", "3"}) ASSERT_FALSE(starts(std::string("http://a/") + name, kAnn));
  for (const char* name : {"x", "y"}) ASSERT_FALSE(starts(std::string("http://b/") + name, kBob));
  EXPECT_EQ(rest(), "1x2y3");
}

class RequestsOfOneUser : public RequestLinesTest {
 protected:
  static constexpr size_t kMost = Limits::activeRequestsOfUserToOneServer;
  static constexpr size_t kLarge = Limits::smallRequestBytesOfUserToOneServer / 4;

  RequestsOfOneUser() : RequestLinesTest(1000, 500) {}
  void fill() {
    for (size_t i = 0; i < kMost; ++i) ASSERT_TRUE(starts("http://one/" + std::to_string(i), kAnn, kLarge));
    ASSERT_FALSE(starts("http://one/late", kAnn, kLarge));
  }
};

// A server that takes its time for each had hundreds of one user's, and came to another user's last.
TEST_F(RequestsOfOneUser, LeaveRoomAtTheServerForOtherUsers) {
  fill();
  EXPECT_FALSE(starts("http://one/bob", kBob)) << "behind one in line";
  const std::shared_ptr<URLTransfer> next = lines_.next();
  ASSERT_NE(next, nullptr);
  EXPECT_EQ(next->request.url, "http://one/bob");
  EXPECT_EQ(lines_.next(), nullptr) << "the user's own waits on";
}

TEST_F(RequestsOfOneUser, GoOnToOtherServers) {
  fill();
  EXPECT_FALSE(starts("http://two/x", kAnn, kLarge)) << "behind one in line";
  const std::shared_ptr<URLTransfer> next = lines_.next();
  ASSERT_NE(next, nullptr);
  EXPECT_EQ(next->request.url, "http://two/x");
}

TEST_F(RequestsOfOneUser, GoOnWhenOneHasEnded) {
  fill();
  lines_.hasGone(*transfers_.front());
  const std::shared_ptr<URLTransfer> next = lines_.next();
  ASSERT_NE(next, nullptr);
  EXPECT_EQ(next->request.url, "http://one/late");
  EXPECT_EQ(lines_.next(), nullptr);
}

TEST_F(RequestsOfOneUser, AreMoreWhileTheyAreSmall) {
  for (size_t i = 0; i < 20 * kMost; ++i) ASSERT_TRUE(starts("http://one/" + std::to_string(i), kAnn, 1024));
}

TEST_F(RequestsOfOneUser, CountOnceEachWhenTheyGoAnew) {
  fill();
  for (int i = 0; i < 3; ++i) {
    lines_.hasGone(*transfers_.front());
    lines_.goesAgain(*transfers_.front());
  }
  EXPECT_EQ(lines_.next(), nullptr);
  lines_.hasGone(*transfers_.front());
  EXPECT_NE(lines_.next(), nullptr);
}

class RequestTurns : public CurlURLSessionFixture {};

TEST_F(RequestTurns, ThousandsOfOneUserInLineHoldUpNoOtherUsersOne) {
  constexpr size_t kPosts = 2000;
  options_.maxActiveRequestsToOneServer = 1;
  UserBudget budget(UserShares::of(Limits(), uint64_t{16} << 30, 4096));
  TestHTTPServer server;
  server.setReply({.behaviour = TestHTTPServer::Behaviour::hold});
  auto anns = session(), bobs = session();
  const auto postOf = [&](uint32_t user, const char* path) {
    URLRequest request = post(server.url(path), "x");
    request.account = budget.account(user);
    return request;
  };
  std::vector<Outcome> outcomes(kPosts);
  for (Outcome& outcome : outcomes) anns->start(postOf(kAnn, "/ann"), outcome.completion());
  ASSERT_TRUE(server.waitForRequests(1));
  Outcome bob;
  bobs->start(postOf(kBob, "/bob"), bob.completion());
  server.release();
  ASSERT_TRUE(bob.wait());
  EXPECT_EQ(bob.status(), 200) << bob.errorText();
  const auto requests = server.requests();
  size_t before = 0;
  while (before < requests.size() && requests[before].target != "/bob") ++before;
  EXPECT_LE(before, 2u);
  factory().cancelAll();
  for (Outcome& outcome : outcomes) EXPECT_TRUE(outcome.wait());
}

TEST_F(RequestTurns, AnotherUsersRequestReachesAServerThatASingleUserKeepsBusy) {
  constexpr size_t kMost = Limits::activeRequestsOfUserToOneServer, kPosts = 6 * kMost;
  UserBudget budget(UserShares::of(Limits(), uint64_t{16} << 30, 4096));
  TestHTTPServer server;
  server.setReply({.behaviour = TestHTTPServer::Behaviour::hold});
  std::vector<decltype(session())> anns;  // each of few connections
  for (size_t n = 0; n < kMost; ++n) anns.push_back(session());
  auto bobs = session();
  const auto postOf = [&](uint32_t user, const char* path, size_t bytes) {
    URLRequest request = post(server.url(path), std::string(bytes, 'x'));
    request.account = budget.account(user);
    return request;
  };
  std::vector<Outcome> outcomes(kPosts);
  for (size_t n = 0; n < kPosts; ++n)
    anns[n % kMost]->start(postOf(kAnn, "/ann", Limits::smallRequestBytesOfUserToOneServer / kMost),
                           outcomes[n].completion());
  ASSERT_TRUE(server.waitForRequests(kMost));
  Outcome bob;
  bobs->start(postOf(kBob, "/bob", 1), bob.completion());
  ASSERT_TRUE(server.waitForRequests(kMost + 1));
  EXPECT_EQ(server.requests().back().target, "/bob");
  server.release();
  EXPECT_TRUE(bob.wait());
  for (Outcome& outcome : outcomes) EXPECT_TRUE(outcome.wait());
  EXPECT_EQ(server.requests().size(), kPosts + 1);
}

}  // namespace
}  // namespace kyt
