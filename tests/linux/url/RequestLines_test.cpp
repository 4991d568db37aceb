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
  ~RequestLinesTest() override {
    for (const auto& transfer : transfers_) transfer->self = nullptr;
  }
  // Puts it in line unless it may go.
  bool starts(const std::string& url, uint32_t user) {
    URLRequest request;
    request.url = url;
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
  RequestLines lines_{1, 1};
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

}  // namespace
}  // namespace kyt
