// What becomes of requests on a session's kept connections when the network goes away and comes back while the server
// knows nothing of it: they wait, and arrive once.
#include <curl/curl.h>

#include <fstream>
#include <sstream>

#include "tests/linux/url/CurlUrlSessionFixture.h"
#include "tests/linux/url/Http2Nginx.h"
#include "tests/support/NetworkNamespace.h"

namespace kyt {
namespace {

using namespace std::chrono_literals;
using Behaviour = TestHTTPServer::Behaviour;

// The server's address lies behind a route. IPv4, and IPv6.
struct Family {
  const char *name, *here, *other, *there, *server, *network;
  const char* ip;  // the command
};
void PrintTo(const Family& family, std::ostream* out) {
  *out << family.name;
}
constexpr Family kFour{"IPv4", "10.77.0.2", "10.77.0.3", "10.77.0.1", "10.78.0.1", "10.78.0.0/24", "ip"};
constexpr Family kSix{"IPv6", "fd77::2", "fd77::3", "fd77::1", "fd78::1", "fd78::/64", "ip -6"};

class KeptConnectionsOffline : public CurlURLSessionFixture, public testing::WithParamInterface<Family> {
 protected:
  void SetUp() override {
    if (!NetworkNamespace::isPermitted()) GTEST_SKIP() << "network namespaces need root";
    options_.certificateFile = authority_.file();
    options_.waitingRetryPeriod = 10min;  // what wakes a request is the kernel
    here_.emplace();
    there_.emplace();
    prefix_ = std::string(family().name) == "IPv6" ? "/64 nodad" : "/24";
    ASSERT_TRUE(here_->connect("eth7", family().here + prefix_, *there_, "eth8", family().there + prefix_));
    ASSERT_TRUE(there_->run(std::string("ip addr add ") + family().server + prefix_ + " dev eth8"));
    ASSERT_TRUE(comeBack());
    server_ = TestHTTPServer::in(*there_, family().server);
    entered_.emplace(*here_);
  }
  void TearDown() override {
    factory_.reset();
    server_.reset();
    entered_.reset();
  }
  static Family family() { return GetParam(); }
  bool ip(const std::string& command) { return here_->run(family().ip + (" " + command)); }
  bool goAway() { return ip(std::string("route del ") + family().network); }
  bool comeBack() { return ip(std::string("route add ") + family().network + " via " + family().there); }
  // Nothing that is sent arrives, and neither end is told.
  bool breakTheWay() {
    return ip(std::string("neigh replace ") + family().there +
              " lladdr 02:00:00:00:00:99 dev eth7 nud permanent");
  }
  bool mendTheWay() { return ip("neigh flush dev eth7 nud permanent"); }
  // This end has another address, with a way to the server.
  bool move() {
    const std::string device = prefix_ + " dev eth7";
    return ip("addr del " + (family().here + device)) && ip("addr add " + (family().other + device)) &&
           ip(std::string("route replace ") + family().network + " via " + family().there);
  }
  bool waitUntilWaiting(uint64_t count) {
    return eventually([&] { return factory().figures().waiting == count; });
  }
  // By the kernel's table.
  static bool anyConnection(const std::string& state, bool withSomethingToSend) {
    for (const char* table : {"/proc/thread-self/net/tcp", "/proc/thread-self/net/tcp6"}) {
      std::ifstream file(table);
      std::string number, local, peer, is, queues;
      for (std::string line; std::getline(file, line);) {
        std::istringstream(line) >> number >> local >> peer >> is >> queues;
        if (is == state && (!withSomethingToSend || !queues.starts_with("00000000"))) return true;
      }
    }
    return false;
  }
  static bool isConnecting() { return anyConnection("02", false); }
  static bool hasUnacknowledged() { return anyConnection("01", true); }
  size_t times(const std::string& body) {
    size_t count = 0;
    for (const auto& request : server_->requests()) count += request.body == body ? 1 : 0;
    return count;
  }

  TestCertificateAuthority authority_;
  std::optional<NetworkNamespace> here_, there_;
  std::optional<NetworkNamespace::Entered> entered_;
  std::unique_ptr<TestHTTPServer> server_;
  std::string prefix_;
};

INSTANTIATE_TEST_SUITE_P(Families, KeptConnectionsOffline, testing::Values(kFour, kSix),
                         [](const auto& family) { return std::string(family.param.name); });

TEST_P(KeptConnectionsOffline, WhatIsPostedWithoutARouteWaitsThoughAConnectionIsKept) {
  auto urls = session(true);
  EXPECT_EQ(perform(*urls, post(server_->url("/"), "before")).status(), 200);
  for (const std::string body : {"one", "two"}) {
    ASSERT_TRUE(goAway());
    Outcome outcome, upload;
    urls->start(post(server_->url("/"), body), outcome.completion());
    URLRequest awaited = post(server_->url("/"), "upload " + body);
    awaited.isAwaited = true;
    urls->start(std::move(awaited), upload.completion());
    ASSERT_TRUE(waitUntilWaiting(2));
    ASSERT_TRUE(comeBack());
    ASSERT_TRUE(outcome.wait() && upload.wait());
    EXPECT_EQ(outcome.status(), 200) << outcome.errorText();
    EXPECT_EQ(upload.status(), 200) << upload.errorText();
    EXPECT_EQ(times(body), 1u);
    EXPECT_EQ(times("upload " + body), 1u);
  }
}

TEST_P(KeptConnectionsOffline, WhatIsPostedWithoutARouteFailsInASessionThatDoesNotWait) {
  auto urls = session(false);
  EXPECT_EQ(perform(*urls, post(server_->url("/"), "before")).status(), 200);
  ASSERT_TRUE(goAway());
  EXPECT_EQ(perform(*urls, post(server_->url("/"), "offline")).errorCode(), CURLE_COULDNT_CONNECT);
  EXPECT_EQ(times("offline"), 0u);
}

TEST_P(KeptConnectionsOffline, WithAnotherAddressNothingGoesOnTheConnectionOfTheFormerOne) {
  auto urls = session(true);
  EXPECT_EQ(perform(*urls, post(server_->url("/"), "before")).status(), 200);
  ASSERT_TRUE(move());
  for (int i = 0; i < 3; ++i) {
    const Outcome outcome = perform(*urls, post(server_->url("/"), "after"));
    EXPECT_EQ(outcome.status(), 200) << outcome.errorText();
  }
  EXPECT_EQ(times("after"), 3u);
  EXPECT_EQ(server_->requests().back().peer, family().other);
  EXPECT_EQ(server_->connectionsAccepted(), 2u);
}

TEST_P(KeptConnectionsOffline, WhatWasOnItsWayWhenTheRouteWentAndDidNotArriveWaits) {
  auto urls = session(true);
  EXPECT_EQ(perform(*urls, post(server_->url("/"), "before")).status(), 200);
  ASSERT_TRUE(breakTheWay());
  Outcome outcome;
  urls->start(post(server_->url("/"), "lost"), outcome.completion());
  ASSERT_TRUE(eventually([&] { return hasUnacknowledged(); }));
  ASSERT_TRUE(goAway());
  ASSERT_TRUE(waitUntilWaiting(1)) << "long before it is stuck";
  ASSERT_TRUE(mendTheWay() && comeBack());
  ASSERT_TRUE(outcome.wait());
  EXPECT_EQ(outcome.status(), 200) << outcome.errorText();
  EXPECT_EQ(times("lost"), 1u);
}

TEST_P(KeptConnectionsOffline, WhatTheServerHasIsNotSentAgainAndItsAnswerIsTakenWhenTheRouteIsBack) {
  auto urls = session(true);
  server_->setReply({.behaviour = Behaviour::hold});
  Outcome outcome;
  urls->start(post(server_->url("/"), "held"), outcome.completion());
  ASSERT_TRUE(server_->waitForRequests(1));
  ASSERT_TRUE(goAway());
  // Long enough for what the server does not have to go back.
  Outcome other;
  urls->start(post(server_->url("/"), "other"), other.completion());
  ASSERT_TRUE(waitUntilWaiting(1));
  EXPECT_FALSE(outcome.wait(3s));
  EXPECT_EQ(factory().figures().waiting, 1u);
  ASSERT_TRUE(comeBack());
  server_->release();
  ASSERT_TRUE(outcome.wait() && other.wait());
  EXPECT_EQ(outcome.status(), 200) << outcome.errorText();
  EXPECT_EQ(times("held"), 1u);
  EXPECT_EQ(times("other"), 1u);
}

TEST_P(KeptConnectionsOffline, WhatIsStuckAndDidNotArriveGoesAgainOnANewConnection) {
  options_.noProgressTimeout = 4s;
  auto urls = session(true);
  EXPECT_EQ(perform(*urls, post(server_->url("/"), "before")).status(), 200);
  ASSERT_TRUE(breakTheWay());
  Outcome outcome;
  urls->start(post(server_->url("/"), "stuck"), outcome.completion());
  ASSERT_TRUE(eventually([&] { return isConnecting(); }));
  ASSERT_TRUE(mendTheWay());
  ASSERT_TRUE(outcome.wait());
  EXPECT_EQ(outcome.status(), 200) << outcome.errorText();
  EXPECT_EQ(times("stuck"), 1u);
  EXPECT_EQ(server_->connectionsAccepted(), 2u);
}

TEST_P(KeptConnectionsOffline, WhatIsStuckAndMayHaveArrivedIsReported) {
  options_.noProgressTimeout = 1s;
  auto urls = session(true);
  server_->setReply({.behaviour = Behaviour::hold});
  Outcome outcome;
  urls->start(post(server_->url("/"), "held"), outcome.completion());
  ASSERT_TRUE(outcome.wait());
  EXPECT_EQ(outcome.errorCode(), CURLE_OPERATION_TIMEDOUT);
  EXPECT_EQ(outcome.errorText(), "The request made no progress");
  EXPECT_EQ(times("held"), 1u);
  server_->setReply({});
  EXPECT_EQ(perform(*urls, post(server_->url("/"), "next")).status(), 200);
  EXPECT_EQ(server_->connectionsAccepted(), 2u) << "nothing more goes on a connection that is stuck";
}

// HTTP/2: what a session posts shares one connection.
class KeptHTTP2ConnectionsOffline : public KeptConnectionsOffline {
 protected:
  void SetUp() override {
    if (!HTTP2Nginx::isHere()) GTEST_SKIP() << "nginx is not installed";
    KeptConnectionsOffline::SetUp();
    if (IsSkipped()) return;
    const NetworkNamespace::Entered entered(*there_);
    nginx_.emplace(authority_.folder(), authority_.issue({family().server}), server_->url(""),
                   family().server);
  }
  std::optional<HTTP2Nginx> nginx_;
};

INSTANTIATE_TEST_SUITE_P(Families, KeptHTTP2ConnectionsOffline, testing::Values(kFour),
                         [](const auto& family) { return std::string(family.param.name); });

TEST_P(KeptHTTP2ConnectionsOffline, WhatIsPostedWithoutARouteWaitsAndArrivesFromAnotherAddress) {
  auto urls = session(true);
  EXPECT_EQ(perform(*urls, post(nginx_->url(), "before")).status(), 200);
  ASSERT_TRUE(goAway());
  std::vector<Outcome> offline(10);
  for (Outcome& outcome : offline) urls->start(post(nginx_->url(), "offline"), outcome.completion());
  ASSERT_TRUE(waitUntilWaiting(10));
  ASSERT_TRUE(move());
  for (Outcome& outcome : offline) {
    ASSERT_TRUE(outcome.wait());
    EXPECT_EQ(outcome.status(), 200) << outcome.errorText();
  }
  EXPECT_EQ(perform(*urls, post(nginx_->url(), "after")).status(), 200);
  EXPECT_EQ(times("offline"), 10u);
}

TEST_P(KeptHTTP2ConnectionsOffline, WhatWasOnItsWayAndDidNotArriveGoesAgainFromAnotherAddress) {
  auto urls = session(true);
  EXPECT_EQ(perform(*urls, post(nginx_->url(), "before")).status(), 200);
  ASSERT_TRUE(breakTheWay());
  std::vector<Outcome> lost(5);
  for (Outcome& outcome : lost) urls->start(post(nginx_->url(), "lost"), outcome.completion());
  ASSERT_TRUE(eventually([&] { return hasUnacknowledged(); }));
  ASSERT_TRUE(move() && mendTheWay());
  const Outcome after = perform(*urls, post(nginx_->url(), "after"));
  EXPECT_EQ(after.status(), 200) << after.errorText();
  for (Outcome& outcome : lost) {
    ASSERT_TRUE(outcome.wait());
    EXPECT_EQ(outcome.status(), 200) << outcome.errorText();
  }
  EXPECT_EQ(times("lost"), 5u);
}

}  // namespace
}  // namespace kyt
