#include <curl/curl.h>

#include <filesystem>
#include <fstream>

#include "platform/base/Limits.h"
#include "platform/base/UserBudget.h"
#include "tests/linux/url/CurlURLSessionFixture.h"
#include "tests/support/NetworkNamespace.h"

namespace kyt {
namespace {

using namespace std::chrono_literals;

// The client's network and the server's, joined by one cable; the server's address lies behind a route, so
// that the tests cut and restore it.
class CurlURLSessionConnectivity : public CurlURLSessionFixture {
 protected:
  void SetUp() override {
    if (!NetworkNamespace::isPermitted()) GTEST_SKIP() << "network namespaces need root";
    here_.emplace();
    there_.emplace();
    ASSERT_TRUE(here_->connect("eth7", "10.77.0.2/24", *there_, "eth8", "10.77.0.1/24"));
    ASSERT_TRUE(there_->run("ip addr add 10.78.0.1/24 dev eth8 && ip route add default via 10.77.0.2"));
    server_ = TestHTTPServer::in(*there_, "10.78.0.1");
    entered_.emplace(*here_);
    options_.waitingRetryPeriod = 10min;  // what wakes a request is the kernel
  }
  void TearDown() override {
    factory_.reset();
    server_.reset();
    entered_.reset();
    std::filesystem::remove_all(folder_);
  }
  bool restoreRoute() { return here_->run("ip route add 10.78.0.0/24 via 10.77.0.1"); }
  bool waitUntilWaiting(uint64_t count) {
    return eventually([&] { return factory().figures().waiting == count; });
  }
  std::string folder() {
    if (folder_.empty()) {
      folder_ = std::filesystem::temp_directory_path() / "kyt-url-XXXXXX";
      EXPECT_NE(mkdtemp(folder_.data()), nullptr);
    }
    return folder_;
  }

  std::optional<NetworkNamespace> here_, there_;
  std::optional<NetworkNamespace::Entered> entered_;
  std::unique_ptr<TestHTTPServer> server_;
  std::string folder_;
};

TEST_F(CurlURLSessionConnectivity, WaitsWithoutARouteAndGoesOutWhenItAppears) {
  auto urls = session(true);
  Outcome outcome;
  urls->start(post(server_->url("/"), "waited"), outcome.completion());
  ASSERT_TRUE(waitUntilWaiting(1));
  EXPECT_EQ(factory().figures().waitingBytes, 6u);
  EXPECT_EQ(factory().outstanding(), 1u);
  EXPECT_FALSE(outcome.isDone());
  ASSERT_TRUE(restoreRoute());
  ASSERT_TRUE(outcome.wait());
  EXPECT_EQ(outcome.status(), 200) << outcome.errorText();
  EXPECT_EQ(server_->requests()[0].body, "waited");
  EXPECT_EQ(factory().figures().waiting, 0u);
  EXPECT_EQ(factory().figures().waitingBytes, 0u);
}

TEST_F(CurlURLSessionConnectivity, FailsAtOnceWhatNeverWaits) {
  auto urls = session(true);
  URLRequest request = post(server_->url("/"), "x");
  request.neverWaits = true;
  const Outcome outcome = perform(*urls, std::move(request));
  EXPECT_EQ(outcome.errorCode(), CURLE_COULDNT_CONNECT);
  EXPECT_EQ(factory().figures().waiting, 0u);
}

TEST_F(CurlURLSessionConnectivity, TellsWhoWatchesThatConnectivityHasChanged) {
  std::atomic<int> changes{0};
  factory().watchConnectivity(std::make_shared<Function<void()>>([&changes] { ++changes; }));
  auto urls = session();
  EXPECT_NE(perform(*urls, get(server_->url("/"))).errorCode(), 0);
  ASSERT_TRUE(restoreRoute());
  EXPECT_TRUE(eventually([&] { return changes > 0; }));
  factory().watchConnectivity(nullptr);
  const int before = changes;
  ASSERT_TRUE(here_->run("ip route del 10.78.0.0/24"));
  EXPECT_NE(perform(*urls, get(server_->url("/"))).errorCode(), 0);
  EXPECT_EQ(changes, before);
}

TEST_F(CurlURLSessionConnectivity, WaitsAgainEachTimeTheRouteVanishes) {
  auto urls = session(true);
  for (int i = 0; i < 3; ++i) {
    std::vector<Outcome> outcomes(5);
    for (Outcome& outcome : outcomes) urls->start(post(server_->url("/"), "x"), outcome.completion());
    ASSERT_TRUE(waitUntilWaiting(5));
    ASSERT_TRUE(restoreRoute());
    for (Outcome& outcome : outcomes) {
      ASSERT_TRUE(outcome.wait());
      EXPECT_EQ(outcome.status(), 200) << outcome.errorText();
    }
    server_->closeConnections();
    ASSERT_TRUE(server_->waitForConnectionsOpen(0));
    ASSERT_TRUE(here_->run("ip route del 10.78.0.0/24"));
  }
  EXPECT_EQ(server_->requestCount(), 15u);
}

TEST_F(CurlURLSessionConnectivity, WaitsWhileTheLinkIsDown) {
  ASSERT_TRUE(restoreRoute());
  ASSERT_TRUE(here_->run("ip link set eth7 down"));
  auto urls = session(true);
  Outcome outcome;
  urls->start(get(server_->url("/")), outcome.completion());
  ASSERT_TRUE(waitUntilWaiting(1));
  ASSERT_TRUE(here_->run("ip link set eth7 up"));
  ASSERT_TRUE(restoreRoute());
  ASSERT_TRUE(outcome.wait());
  EXPECT_EQ(outcome.status(), 200) << outcome.errorText();
}

TEST_F(CurlURLSessionConnectivity, WaitsWhileTheCableIsUnplugged) {
  ASSERT_TRUE(restoreRoute());
  ASSERT_TRUE(there_->run("ip link set eth8 down"));
  auto urls = session(true);
  Outcome outcome;
  urls->start(get(server_->url("/")), outcome.completion());
  ASSERT_TRUE(waitUntilWaiting(1));  // when nobody answered the question who has the gateway's address
  ASSERT_TRUE(there_->run("ip link set eth8 up && ip route add default via 10.77.0.2"));
  ASSERT_TRUE(outcome.wait());
  EXPECT_EQ(outcome.status(), 200) << outcome.errorText();
}

TEST_F(CurlURLSessionConnectivity, FailsAtOnceInASessionThatDoesNotWait) {
  auto urls = session(false);
  EXPECT_EQ(perform(*urls, get(server_->url("/"))).errorCode(), CURLE_COULDNT_CONNECT);
}

TEST_F(CurlURLSessionConnectivity, TimesOutWhileItWaits) {
  auto urls = session(true);
  URLRequest request = get(server_->url("/"));
  request.timeout = 300ms;
  const auto before = std::chrono::steady_clock::now();
  const Outcome outcome = perform(*urls, std::move(request));
  EXPECT_EQ(outcome.errorCode(), CURLE_OPERATION_TIMEDOUT);
  EXPECT_GE(std::chrono::steady_clock::now() - before, 300ms);
  EXPECT_EQ(factory().figures().waiting, 0u);
}

TEST_F(CurlURLSessionConnectivity, OutlastsTheNoProgressTimeOutWhileItWaits) {
  options_.noProgressTimeout = 2s;  // time enough for what follows the wait
  auto urls = session(true);
  Outcome outcome;
  urls->start(get(server_->url("/")), outcome.completion());
  ASSERT_TRUE(waitUntilWaiting(1));
  EXPECT_FALSE(outcome.wait(2500ms));
  ASSERT_TRUE(restoreRoute());
  ASSERT_TRUE(outcome.wait());
  EXPECT_EQ(outcome.status(), 200) << outcome.errorText();
}

TEST_F(CurlURLSessionConnectivity, IsSentAfterItsSessionIsReleased) {
  auto urls = session(true);
  Outcome outcome;
  urls->start(get(server_->url("/")), outcome.completion());
  ASSERT_TRUE(waitUntilWaiting(1));
  urls.reset();
  ASSERT_TRUE(restoreRoute());
  ASSERT_TRUE(outcome.wait());
  EXPECT_EQ(outcome.status(), 200);
}

TEST_F(CurlURLSessionConnectivity, IsCancelledWhileItWaits) {
  auto urls = session(true);
  Outcome one, two;
  const auto task = urls->start(get(server_->url("/")), one.completion());
  urls->start(get(server_->url("/")), two.completion());
  ASSERT_TRUE(waitUntilWaiting(2));
  task->cancel();
  ASSERT_TRUE(one.wait());
  EXPECT_EQ(one.errorCode(), kURLErrorCancelled);
  EXPECT_FALSE(two.isDone());
  factory().cancelAll();
  ASSERT_TRUE(two.wait());
  EXPECT_EQ(two.errorCode(), kURLErrorCancelled);
  EXPECT_EQ(factory().figures().waiting, 0u);
  EXPECT_EQ(factory().figures().waitingBytes, 0u);
}

TEST_F(CurlURLSessionConnectivity, IsCancelledWhileItWaitsForTheNetworkAndAThreadForIt) {
  auto urls = session(true);
  Outcome awaited, plain;
  URLRequest request = post(server_->url("/"), "awaited");
  request.isAwaited = true;
  urls->start(std::move(request), awaited.completion());
  urls->start(post(server_->url("/"), "plain"), plain.completion());
  ASSERT_TRUE(waitUntilWaiting(2));
  factory().cancelAwaited();
  ASSERT_TRUE(awaited.wait());
  EXPECT_EQ(awaited.errorCode(), kURLErrorCancelled);
  EXPECT_EQ(factory().figures().waiting, 1u);
  EXPECT_EQ(factory().figures().waitingBytes, 5u);
  ASSERT_TRUE(restoreRoute());
  ASSERT_TRUE(plain.wait());
  EXPECT_EQ(plain.status(), 200) << plain.errorText();
  EXPECT_EQ(server_->requestCount(), 1u);
}

TEST_F(CurlURLSessionConnectivity, DropsTheOldestWhenTooMuchOfASessionWaits) {
  auto urls = session(true), other = session(true);
  Outcome unaffected;
  other->start(post(server_->url("/other"), std::string(1u << 20, 'o')), unaffected.completion());
  std::vector<Outcome> outcomes(6);
  constexpr size_t kBody = (4u << 20) - 1024;  // and some bytes of headers
  for (size_t i = 0; i < outcomes.size(); ++i)
    urls->start(post(server_->url("/" + std::to_string(i)), std::string(kBody, 'b')),
                outcomes[i].completion());
  ASSERT_TRUE(outcomes[0].wait() && outcomes[1].wait());
  EXPECT_EQ(outcomes[0].errorCode(), kURLErrorWaitingTooMuch);
  EXPECT_EQ(outcomes[1].errorCode(), kURLErrorWaitingTooMuch);
  ASSERT_TRUE(waitUntilWaiting(5));
  EXPECT_EQ(factory().figures().waitingBytes, (1u << 20) + 4 * kBody);
  EXPECT_EQ(factory().figures().droppedWhileWaiting, 2u);
  EXPECT_EQ(counters_.value(Reason::waitingRequestDisplaced), 2u);
  EXPECT_EQ(sink_.count("more than 16777216 bytes wait for connectivity"), 1u);
  ASSERT_TRUE(restoreRoute());
  for (size_t i = 2; i < outcomes.size(); ++i) {
    ASSERT_TRUE(outcomes[i].wait());
    EXPECT_EQ(outcomes[i].status(), 200) << outcomes[i].errorText();
  }
  ASSERT_TRUE(unaffected.wait());
  EXPECT_EQ(unaffected.status(), 200);
}

// Single messages of all users share a session.
TEST_F(CurlURLSessionConnectivity, DropsTheOldestOfTheUserOfWhomTooMuchWaits) {
  UserBudget budget(UserShares::of(Limits(), uint64_t{8} << 30, 1024));
  auto urls = session(true);
  const auto start = [&](uint32_t user, size_t bytes, Outcome& outcome) {
    URLRequest request = post(server_->url("/"), std::string(bytes, 'b'));
    request.account = budget.account(user);
    urls->start(std::move(request), outcome.completion());
  };
  Outcome first, last;
  start(1, 1000, first);
  std::vector<Outcome> outcomes(26);
  for (Outcome& outcome : outcomes) start(2, 900000, outcome);
  start(1, 1000, last);
  for (size_t i = 0; i < 8; ++i) {
    ASSERT_TRUE(outcomes[i].wait());
    EXPECT_EQ(outcomes[i].errorCode(), kURLErrorWaitingTooMuch);
  }
  ASSERT_TRUE(waitUntilWaiting(20));
  EXPECT_FALSE(first.isDone());
  EXPECT_FALSE(last.isDone());
  ASSERT_TRUE(restoreRoute());
  ASSERT_TRUE(first.wait() && last.wait());
  EXPECT_EQ(first.status(), 200) << first.errorText();
  EXPECT_EQ(last.status(), 200) << last.errorText();
  EXPECT_TRUE(eventually([&] { return factory().outstanding() == 0; }));
  EXPECT_TRUE(budget.account(2)->holdsNothing());
}

TEST_F(CurlURLSessionConnectivity, CountsHeadersTowardsWhatWaits) {
  auto urls = session(true);
  std::vector<Outcome> outcomes(5);
  for (Outcome& outcome : outcomes) {
    URLRequest request = post(server_->url("/"), "x");
    request.headers = {{"X-KYT-Client-Name", std::string(4u << 20, 'n')}};
    urls->start(std::move(request), outcome.completion());
  }
  ASSERT_TRUE(outcomes[0].wait() && outcomes[1].wait());
  EXPECT_EQ(outcomes[0].errorCode(), kURLErrorWaitingTooMuch);
  EXPECT_EQ(outcomes[1].errorCode(), kURLErrorWaitingTooMuch);
  ASSERT_TRUE(waitUntilWaiting(3));
}

TEST_F(CurlURLSessionConnectivity, WaitsWhileNoNameServerHasARoute) {
  options_.resolverFile = folder() + "/resolv.conf";
  std::ofstream(options_.resolverFile) << "nameserver 10.99.0.1\n";
  auto urls = session(true), impatient = session(false);
  Outcome outcome;
  urls->start(get("http://host.kyt.invalid/"), outcome.completion());
  ASSERT_TRUE(waitUntilWaiting(1));
  EXPECT_EQ(perform(*impatient, get("http://host.kyt.invalid/")).errorCode(), CURLE_COULDNT_RESOLVE_HOST);
  EXPECT_FALSE(outcome.isDone());
  // Now the name server could be asked; that it knows no such host is an answer.
  ASSERT_TRUE(here_->run("ip route add 10.99.0.0/24 via 10.77.0.1"));
  ASSERT_TRUE(outcome.wait());
  EXPECT_EQ(outcome.errorCode(), CURLE_COULDNT_RESOLVE_HOST);
}

int threadsNamed(const std::string& wanted) {
  int count = 0;
  for (const auto& task : std::filesystem::directory_iterator("/proc/self/task")) {
    std::string name;
    std::getline(std::ifstream(task.path() / "comm") >> std::ws, name);
    count += name == wanted ? 1 : 0;
  }
  return count;
}

TEST_F(CurlURLSessionConnectivity, GivesUpALookUpOfANameAtOnce) {
  std::string server;
  std::ifstream file("/etc/resolv.conf");
  for (std::string word; file >> word;)
    if (word == "nameserver" && file >> server) break;
  if (server.empty() || server.starts_with("127.") || server.find(':') != std::string::npos)
    GTEST_SKIP() << "this machine's name server is not one that the test can make silent";
  // The name server's address leads where nobody answers.
  ASSERT_TRUE(here_->run("ip route add " + server + " via 10.77.0.1") &&
              there_->run("ip route add blackhole " + server));
  auto urls = session(true);
  Outcome cancelled, late;
  const auto task = urls->start(get("http://host.kyt.invalid/"), cancelled.completion());
  URLRequest request = get("http://other.kyt.invalid/");
  request.timeout = 300ms;
  urls->start(std::move(request), late.completion());
  ASSERT_TRUE(late.wait());
  EXPECT_EQ(late.errorCode(), CURLE_OPERATION_TIMEDOUT);
  EXPECT_FALSE(cancelled.isDone());
  task->cancel();
  ASSERT_TRUE(cancelled.wait());
  factory_.reset();
  // Nobody has waited for the look-ups, which take five seconds and more: they are still there.
  EXPECT_GT(threadsNamed("kyt-network"), 0);
}

// A second way to the server, over an interface that counts as cellular.
class CurlURLSessionCellular : public CurlURLSessionConnectivity {
 protected:
  void SetUp() override {
    CurlURLSessionConnectivity::SetUp();
    if (IsSkipped()) return;
    ASSERT_TRUE(here_->connect(cellular_, "10.80.0.2/24", *there_, "cell8", "10.80.0.1/24"));
    ASSERT_TRUE(here_->run("ip route add default via 10.80.0.1 metric 10"));
  }
  URLRequest wifiOnly() {
    URLRequest request = get(server_->url("/wifi"));
    request.allowsCellularAccess = false;
    return request;
  }
  std::string cellular_ = "wwan0";
};

TEST_F(CurlURLSessionCellular, HoldsARequestThatMayNotUseItUntilAnotherRouteAppears) {
  auto urls = session(true);
  EXPECT_EQ(perform(*urls, get(server_->url("/any"))).status(), 200);  // its connection must not be used
  Outcome outcome;
  urls->start(wifiOnly(), outcome.completion());
  ASSERT_TRUE(waitUntilWaiting(1));
  ASSERT_TRUE(here_->run("ip route add 10.78.0.0/24 via 10.77.0.1"));
  ASSERT_TRUE(outcome.wait());
  EXPECT_EQ(outcome.status(), 200) << outcome.errorText();
  const auto requests = server_->requests();
  ASSERT_EQ(requests.size(), 2u);
  EXPECT_EQ(requests[0].peer, "10.80.0.2");
  EXPECT_EQ(requests[1].peer, "10.77.0.2");
}

TEST_F(CurlURLSessionCellular, TakesALessPreferredRouteThatAvoidsIt) {
  ASSERT_TRUE(here_->run("ip route add default via 10.77.0.1 metric 600"));
  auto urls = session(true);
  EXPECT_EQ(perform(*urls, get(server_->url("/any"))).status(), 200);
  EXPECT_EQ(perform(*urls, wifiOnly()).status(), 200);
  EXPECT_EQ(server_->requests()[0].peer, "10.80.0.2");
  EXPECT_EQ(server_->requests()[1].peer, "10.77.0.2");
}

TEST_F(CurlURLSessionCellular, FailsARequestThatMayNotUseItInASessionThatDoesNotWait) {
  auto urls = session(false);
  const Outcome outcome = perform(*urls, wifiOnly());
  EXPECT_EQ(outcome.errorCode(), CURLE_COULDNT_CONNECT);
  EXPECT_EQ(outcome.errorText(),
            "The request may not use cellular interfaces, and no other leads to the server");
  EXPECT_EQ(server_->connectionsAccepted(), 0u);
}

TEST_F(CurlURLSessionCellular, DoesNotFollowAnOpenConnectionOntoACellularRoute) {
  ASSERT_TRUE(here_->run("ip route add 10.78.0.0/24 via 10.77.0.1"));
  auto urls = session(true);
  EXPECT_EQ(perform(*urls, wifiOnly()).status(), 200);
  // Now the route table leads over the cellular interface alone.
  ASSERT_TRUE(here_->run("ip route del 10.78.0.0/24"));
  Outcome outcome;
  urls->start(wifiOnly(), outcome.completion());
  ASSERT_TRUE(waitUntilWaiting(1));
  ASSERT_TRUE(here_->run("ip route add 10.78.0.0/24 via 10.77.0.1"));
  ASSERT_TRUE(outcome.wait());
  EXPECT_EQ(outcome.status(), 200) << outcome.errorText();
  for (const auto& request : server_->requests()) EXPECT_EQ(request.peer, "10.77.0.2");
  EXPECT_EQ(server_->requestCount(), 2u);
}

// What the kernel marks is cellular whatever its name; and a mark that goes is no event of the network: the
// slow timer sees it.
class CurlURLSessionMarkedInterface : public CurlURLSessionCellular {
 protected:
  CurlURLSessionMarkedInterface() { cellular_ = "modem3"; }
};

TEST_F(CurlURLSessionMarkedInterface, IsCellularAsLongAsTheKernelSaysSo) {
  options_.sysClassNet = folder();
  options_.waitingRetryPeriod = 500ms;
  std::filesystem::create_directory(folder() + "/modem3");
  std::ofstream(folder() + "/modem3/uevent") << "DEVTYPE=wwan\nINTERFACE=modem3\n";
  auto urls = session(true);
  Outcome outcome;
  urls->start(wifiOnly(), outcome.completion());
  ASSERT_TRUE(waitUntilWaiting(1));
  std::ofstream(folder() + "/modem3/uevent") << "INTERFACE=modem3\n";
  ASSERT_TRUE(outcome.wait());
  EXPECT_EQ(outcome.status(), 200) << outcome.errorText();
  EXPECT_EQ(server_->requests()[0].peer, "10.80.0.2");
}

}  // namespace
}  // namespace kyt
