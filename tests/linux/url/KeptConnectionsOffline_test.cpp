// What becomes of requests on a session's kept connections when the network goes away and comes back while the server
// knows nothing of it: they wait, and arrive once.
#include <curl/curl.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <fstream>
#include <sstream>

#include "tests/linux/url/CurlURLSessionFixture.h"
#include "tests/linux/url/Http2Nginx.h"
#include "tests/support/NetworkNamespace.h"

namespace {
std::atomic<bool> subscriptionsFail{false};
}

// In place of the C library's: what asks the kernel for its route events does not wait, what asks for a route does.
extern "C" int socket(int family, int type, int protocol) {
  if (subscriptionsFail && family == AF_NETLINK && (type & SOCK_NONBLOCK) != 0) {
    errno = EMFILE;
    return -1;
  }
  return static_cast<int>(syscall(SYS_socket, family, type, protocol));
}

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
  // The local addresses of those that are.
  static std::string connecting() {
    std::string all;
    for (const char* table : {"/proc/thread-self/net/tcp", "/proc/thread-self/net/tcp6"}) {
      std::ifstream file(table);
      std::string number, local, peer, is;
      for (std::string line; std::getline(file, line);)
        if (std::istringstream(line) >> number >> local >> peer >> is && is == "02") all += local + " ";
    }
    return all;
  }
  static bool hasUnacknowledged() { return anyConnection("01", true); }
  size_t times(const std::string& body) {
    size_t count = 0;
    for (const auto& request : server_->requests()) count += request.body == body ? 1 : 0;
    return count;
  }
  // Whether it ends with the server's reply.
  static testing::AssertionResult succeeds(const Outcome& outcome) {
    if (!outcome.wait()) return testing::AssertionFailure() << "it does not end";
    if (outcome.status() == 200) return testing::AssertionSuccess();
    return testing::AssertionFailure() << outcome.status() << ": " << outcome.errorText();
  }
  testing::AssertionResult arrives(URLSession& urls, const std::string& body) {
    return succeeds(perform(urls, post(server_->url("/"), body)));
  }
  // Breaks the way and posts: what is sent on a kept connection does not arrive. Whether it has been sent.
  bool lose(URLSession& urls, Outcome& outcome) {
    if (!breakTheWay()) return false;
    urls.start(post(server_->url("/"), "lost"), outcome.completion());
    return eventually([] { return hasUnacknowledged(); });
  }
  // The same without a kept connection. Whether one is being made.
  bool connectInVain(URLSession& urls, Outcome& outcome) {
    if (!breakTheWay()) return false;
    urls.start(post(server_->url("/"), "x"), outcome.completion());
    return eventually([] { return isConnecting(); });
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
  ASSERT_TRUE(arrives(*urls, "before"));
  for (const std::string body : {"one", "two"}) {
    ASSERT_TRUE(goAway());
    Outcome outcome, upload;
    urls->start(post(server_->url("/"), body), outcome.completion());
    URLRequest awaited = post(server_->url("/"), "upload " + body);
    awaited.isAwaited = true;
    urls->start(std::move(awaited), upload.completion());
    ASSERT_TRUE(waitUntilWaiting(2));
    ASSERT_TRUE(comeBack());
    EXPECT_TRUE(succeeds(outcome));
    EXPECT_TRUE(succeeds(upload));
    EXPECT_EQ(times(body), 1u);
    EXPECT_EQ(times("upload " + body), 1u);
  }
}

TEST_P(KeptConnectionsOffline, WhatIsPostedWithoutARouteFailsInASessionThatDoesNotWait) {
  auto urls = session(false);
  ASSERT_TRUE(arrives(*urls, "before"));
  ASSERT_TRUE(goAway());
  EXPECT_EQ(perform(*urls, post(server_->url("/"), "offline")).errorCode(), CURLE_COULDNT_CONNECT);
  EXPECT_EQ(times("offline"), 0u);
}

TEST_P(KeptConnectionsOffline, WithAnotherAddressNothingGoesOnTheConnectionOfTheFormerOne) {
  auto urls = session(true);
  ASSERT_TRUE(arrives(*urls, "before"));
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
  ASSERT_TRUE(arrives(*urls, "before"));
  Outcome outcome;
  ASSERT_TRUE(lose(*urls, outcome));
  ASSERT_TRUE(goAway());
  ASSERT_TRUE(waitUntilWaiting(1)) << "long before it is stuck";
  ASSERT_TRUE(mendTheWay() && comeBack());
  EXPECT_TRUE(succeeds(outcome));
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
  EXPECT_TRUE(succeeds(outcome));
  ASSERT_TRUE(other.wait());
  EXPECT_EQ(times("held"), 1u);
  EXPECT_EQ(times("other"), 1u);
}

TEST_P(KeptConnectionsOffline, WhatIsStuckAndDidNotArriveGoesAgainOnANewConnection) {
  options_.noProgressTimeout = 4s;
  auto urls = session(true);
  ASSERT_TRUE(arrives(*urls, "before"));
  ASSERT_TRUE(breakTheWay());
  Outcome outcome;
  urls->start(post(server_->url("/"), "stuck"), outcome.completion());
  ASSERT_TRUE(eventually([&] { return isConnecting(); }));
  ASSERT_TRUE(mendTheWay());
  EXPECT_TRUE(succeeds(outcome));
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

// How soon is meant by "at once" here: a connection that leads nowhere is given up after 30 s, a request that makes no
// progress after 60.
constexpr auto kSoon = 15s;

TEST_P(KeptConnectionsOffline, WhatWasAboutToConnectWhenTheRouteWentWaits) {
  auto urls = session(true);
  Outcome outcome;
  ASSERT_TRUE(connectInVain(*urls, outcome));
  const auto start = std::chrono::steady_clock::now();
  ASSERT_TRUE(goAway());
  ASSERT_TRUE(waitUntilWaiting(1));
  EXPECT_LT(std::chrono::steady_clock::now() - start, kSoon);
  ASSERT_TRUE(mendTheWay() && comeBack());
  EXPECT_TRUE(succeeds(outcome));
  EXPECT_EQ(times("x"), 1u);
}

TEST_P(KeptConnectionsOffline, WhatWasAboutToConnectFromAFormerAddressConnectsFromTheNewOne) {
  ASSERT_TRUE(breakTheWay());
  auto urls = session(true);
  std::vector<Outcome> outcomes(3);
  for (Outcome& outcome : outcomes) urls->start(post(server_->url("/"), "x"), outcome.completion());
  ASSERT_TRUE(eventually([&] { return isConnecting(); }));
  const auto start = std::chrono::steady_clock::now();
  ASSERT_TRUE(move() && mendTheWay());
  for (Outcome& outcome : outcomes) EXPECT_TRUE(succeeds(outcome));
  EXPECT_LT(std::chrono::steady_clock::now() - start, kSoon);
  EXPECT_EQ(times("x"), 3u);
  EXPECT_EQ(server_->requests().back().peer, family().other);
}

TEST_P(KeptConnectionsOffline, WhatIsAboutToConnectIsNotDisturbedByChangesElsewhere) {
  auto urls = session(true);
  Outcome outcome;
  ASSERT_TRUE(connectInVain(*urls, outcome));
  const std::string before = connecting();
  for (int i = 0; i < 5; ++i) {
    ASSERT_TRUE(here_->run("ip addr add 10.90.0.1/32 dev lo && ip addr del 10.90.0.1/32 dev lo"));
    // By now the network thread has taken up the changes, or it does so in the next round.
    EXPECT_FALSE(outcome.wait(100ms));
  }
  EXPECT_EQ(connecting(), before);
  ASSERT_TRUE(mendTheWay());
  EXPECT_TRUE(succeeds(outcome));
}

// A session has eight connections to one server at most.
TEST_P(KeptConnectionsOffline, WhatHadNoConnectionYetDoesNotWaitForThoseOfAFormerAddress) {
  server_->setHandler([](const TestHTTPServer::Request& request) {
    TestHTTPServer::Reply reply;
    if (request.body == "held") reply.behaviour = Behaviour::hold;
    return reply;
  });
  auto urls = session(true);
  std::vector<Outcome> held(8), next(2);
  for (Outcome& outcome : held) urls->start(post(server_->url("/"), "held"), outcome.completion());
  ASSERT_TRUE(server_->waitForRequests(8));
  for (Outcome& outcome : next) urls->start(post(server_->url("/"), "next"), outcome.completion());
  EXPECT_FALSE(next[0].wait(200ms));
  const auto start = std::chrono::steady_clock::now();
  ASSERT_TRUE(move());
  for (Outcome& outcome : next) EXPECT_TRUE(succeeds(outcome));
  EXPECT_LT(std::chrono::steady_clock::now() - start, kSoon);
  EXPECT_EQ(times("held"), 8u);
  EXPECT_EQ(times("next"), 2u);
}

TEST_P(KeptConnectionsOffline,
       APostOfWhichAPartHasArrivedWhenTheAddressChangesIsReportedAndTheNextIsNotDelayed) {
  options_.noProgressTimeout = 3s;
  auto urls = session(true);
  ASSERT_TRUE(arrives(*urls, "before"));
  Outcome cut;
  const std::string large(200u << 20, 'l');  // more than is sent before the address changes
  urls->start(post(server_->url("/"), large), cut.completion());
  ASSERT_TRUE(eventually([&] { return hasUnacknowledged(); }));
  ASSERT_TRUE(move());
  const auto start = std::chrono::steady_clock::now();
  EXPECT_TRUE(arrives(*urls, "after"));
  EXPECT_LT(std::chrono::steady_clock::now() - start, kSoon);
  ASSERT_TRUE(cut.wait());
  EXPECT_NE(cut.errorCode(), 0);
  EXPECT_EQ(server_->requestCount(), 2u);
  EXPECT_EQ(server_->connectionsAccepted(), 2u) << "none for another attempt";
  EXPECT_EQ(factory().figures().failed, 1u);
}

// The kernel's events cannot be had: too many descriptors are open, say.
class KeptConnectionsUntold : public KeptConnectionsOffline {
 protected:
  void SetUp() override {
    subscriptionsFail = true;
    KeptConnectionsOffline::SetUp();
  }
  void TearDown() override {
    subscriptionsFail = false;
    KeptConnectionsOffline::TearDown();
  }
};

INSTANTIATE_TEST_SUITE_P(Families, KeptConnectionsUntold, testing::Values(kFour, kSix),
                         [](const auto& family) { return std::string(family.param.name); });

TEST_P(KeptConnectionsUntold, NothingGoesOnTheConnectionOfAFormerAddress) {
  auto urls = session(true);
  ASSERT_TRUE(arrives(*urls, "before"));
  ASSERT_TRUE(move());
  const auto start = std::chrono::steady_clock::now();
  EXPECT_TRUE(arrives(*urls, "after"));
  EXPECT_LT(std::chrono::steady_clock::now() - start, kSoon);
  EXPECT_EQ(server_->requests().back().peer, family().other);
}

TEST_P(KeptConnectionsUntold, WhatIsOnItsWayIsLookedAtByTheSlowTimer) {
  options_.waitingRetryPeriod = 1s;
  auto urls = session(true);
  ASSERT_TRUE(arrives(*urls, "before"));
  Outcome outcome;
  ASSERT_TRUE(lose(*urls, outcome));
  const auto start = std::chrono::steady_clock::now();
  ASSERT_TRUE(goAway());
  ASSERT_TRUE(waitUntilWaiting(1));
  EXPECT_LT(std::chrono::steady_clock::now() - start, kSoon);
  ASSERT_TRUE(mendTheWay() && comeBack());
  EXPECT_TRUE(succeeds(outcome));
  EXPECT_EQ(times("lost"), 1u);
}

TEST_P(KeptConnectionsUntold, OnceTheKernelCanTellWhatHappenedMeanwhileIsLookedAt) {
  // Or the kernel would tell of these addresses in the middle of it.
  ASSERT_TRUE(eventually([&] { return !here_->run("ip -6 address show tentative | grep -q ."); }));
  auto urls = session(true);
  ASSERT_TRUE(arrives(*urls, "before"));
  Outcome lost;
  ASSERT_TRUE(lose(*urls, lost));
  ASSERT_TRUE(goAway());
  subscriptionsFail = false;
  auto others = session(true);
  const std::string next = family().there;
  Outcome other;  // that is on its way for long enough
  others->start(post("http://" + (prefix_ == "/24" ? next : "[" + next + "]") + ":9/", "other"),
                other.completion());
  ASSERT_TRUE(waitUntilWaiting(1));
  ASSERT_TRUE(mendTheWay() && comeBack());
  EXPECT_TRUE(succeeds(lost));
  EXPECT_EQ(times("lost"), 1u);
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
  for (Outcome& outcome : offline) EXPECT_TRUE(succeeds(outcome));
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
  for (Outcome& outcome : lost) EXPECT_TRUE(succeeds(outcome));
  EXPECT_EQ(times("lost"), 5u);
}

}  // namespace
}  // namespace kyt
