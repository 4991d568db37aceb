// The owner's consent as the wire sees it: the whole daemon in a network of its own, where every packet is watched. The
// storebag server and the servers that the storebag names have addresses of their own.
#include <gtest/gtest.h>

#include <memory>
#include <optional>
#include <set>
#include <string>

#include "tests/integration/DaemonProcess.h"
#include "tests/integration/TestClient.h"
#include "tests/support/NetworkNamespace.h"
#include "tests/support/PacketCapture.h"
#include "tests/support/TestHTTPServer.h"

namespace kyt {
namespace {

constexpr int kTorvel = 5;
constexpr char kBagServer[] = "10.77.0.1";
constexpr char kEventServer[] = "10.77.0.3";
using Addresses = std::set<std::string>;

class Consent : public ::testing::Test {
 protected:
  void SetUp() override {
    if (!NetworkNamespace::isPermitted()) GTEST_SKIP() << "network namespaces need root";
    here_.emplace();
    there_.emplace();
    // Without IPv6 the kernel itself sends nothing but what answers for addresses of the cable.
    for (const NetworkNamespace* network : {&*here_, &*there_}) {
      ASSERT_TRUE(
          network->run("for f in all default; do f=/proc/sys/net/ipv6/conf/$f/disable_ipv6; "
                       "[ ! -e $f ] || echo 1 > $f; done"));
    }
    ASSERT_TRUE(here_->connect("eth7", "10.77.0.2/24", *there_, "eth8", std::string(kBagServer) + "/24"));
    ASSERT_TRUE(there_->run(std::string("ip addr add ") + kEventServer + "/24 dev eth8"));
    bags_ = TestHTTPServer::in(*there_, kBagServer);
    events_ = TestHTTPServer::in(*there_, kEventServer);
    serveBag();
    daemon_.emplace(url(kBagServer, *bags_));
    daemon_->root().write("etc/kytreportingd/device.toml", "ReleaseType = \"Internal\"\ncountry = \"DE\"\n");
  }
  void TearDown() override {
    if (running_) endDaemon();
  }
  static std::string url(const char* address, const TestHTTPServer& server) {
    return std::string("http://") + address + ":" + std::to_string(server.port());
  }
  // Every back end that could send: posters whose entry respects the consent, a feed, uploads.
  void serveBag() {
    const std::string there = url(kEventServer, *events_);
    Array entries;
    for (const char* user : {"program", "granted", "withdrawn", "running", "configured-again",
                             "granted-later", "granted-again"}) {
      entries.append(Dictionary{{"client", user},
                                {"locale_whitelist", Array{"DE"}},
                                {"filters", Array{}},
                                {"sampling_threshold", 1.0},
                                {"event_threshold", 2},
                                {"post_url", there + "/" + user}});
    }
    const Dictionary poster{{"clients", entries}};
    const Dictionary section{
        {"httppost", poster},
        {"httppost2", poster},
        {"qrs", poster},
        {"dashboard",
         Dictionary{{"ip", kEventServer}, {"port", 9}, {"reliable", 10}, {"post_url", there + "/log"}}},
        {"uploadserver", Dictionary{{"post_url", there + "/upload"}}}};
    bags_->setReply(
        {.headers = {{"Last-Modified", "Sat, 31 Jan 2026 12:00:00 GMT"}},
         .body = signedBag(Dictionary{{"version", "1"}, {"vantu_internal", section}}, propertyLists_)});
  }
  void setConsent(bool given) {
    daemon_->root().write("var/lib/kytreportingd/defaults/com.vantu.diagnostics.toml",
                          given ? "consent = true\n" : "consent = false\n");
  }
  void startDaemon() {
    const NetworkNamespace::Entered entered(*here_);
    capture_.emplace(*here_);
    running_ = daemon_->startAndWait();
    ASSERT_TRUE(running_) << daemon_->log();
  }
  // Nothing leaves after it.
  void endDaemon() {
    daemon_->terminate();
    EXPECT_EQ(daemon_->exitStatus(), 0) << daemon_->log();
    running_ = false;
  }
  // All that a client can do with events, with every flag up to that one.
  void report(TestClient& client, uint32_t flags) {
    client->updateSharedData(Dictionary{{"shared", 1}});
    for (uint32_t flag = 0; flag <= flags; ++flag)
      for (int i = 0; i < 5; ++i) EXPECT_TRUE(client.send(9, 1, Dictionary{{"number", i}}, flag));
    EXPECT_NE(client.flush(), "no answer");
  }
  std::string states(TestClient& client, const std::string& user) {
    auto answer = std::make_shared<std::promise<std::string>>();
    client->fetchStates(
        Dictionary{{kKYTReportingUserInfoClientName, user}, {kKYTReportingUserInfoServiceName, "test"}},
        [answer](const std::optional<std::vector<std::string>>& states, const std::optional<Error>&) {
          std::string text;
          for (const std::string& name : states.value_or(std::vector<std::string>{})) text += name + " ";
          answer->set_value(text);
        });
    return TestClient::waitFor(answer);
  }
  size_t posts(const std::string& user) {
    size_t count = 0;
    for (const auto& request : events_->requests()) count += request.target == "/" + user ? 1 : 0;
    return count;
  }

  PugixmlPropertyLists propertyLists_;
  std::optional<NetworkNamespace> here_, there_;
  std::unique_ptr<TestHTTPServer> bags_, events_;
  std::optional<DaemonProcess> daemon_;
  std::optional<PacketCapture> capture_;
  bool running_ = false;
};

constexpr char kPosters[] = "httppost";

TEST_F(Consent, WithoutItOnlyTheStorebagServerIsSpokenTo) {
  setConsent(false);
  startDaemon();
  {
    TestClient client(daemon_->socketPath(), kTorvel, "program");
    const std::string live = client.configure();
    EXPECT_EQ(live.find(kPosters), std::string::npos) << live;
    report(client, 3);
    EXPECT_EQ(states(client, "running").find(kPosters), std::string::npos);
    report(client, 3);
    EXPECT_TRUE(client.finish());
  }
  {
    TestClient cutOff(daemon_->socketPath(), kTorvel, "program", 78);
    cutOff.configure();
    report(cutOff, 3);
  }
  KYTReporting::Options options;
  options.socketPath = daemon_->socketPath();
  options.sessionInfo = Dictionary{{kKYTReportingSessionInfoClientType, kTorvel},
                                   {kKYTReportingSessionInfoRequireUserInfo, true}};
  options.userInfo = Dictionary{{kKYTReportingUserInfoClientName, "program"}};
  auto single = std::make_shared<std::promise<std::string>>();
  KYTReporting::sendSingleMessage(
      std::move(options), 9, 1, Dictionary{{"k", 1}},
      [single](const std::string& text, const std::optional<Error>&) { single->set_value(text); });
  EXPECT_NE(TestClient::waitFor(single), "no answer");
  endDaemon();
  EXPECT_EQ(capture_->peers(), Addresses{kBagServer}) << daemon_->log();
  EXPECT_EQ(events_->connectionsAccepted(), 0U);
}

TEST_F(Consent, WithoutItAnUndecidedSessionEndsInSilenceToo) {
  setConsent(false);
  startDaemon();
  {
    KYTReporting::Options options;
    options.socketPath = daemon_->socketPath();
    options.sessionInfo = Dictionary{{kKYTReportingSessionInfoClientType, kTorvel},
                                     {kKYTReportingSessionInfoBatchEvent, true},
                                     {kKYTReportingSessionInfoRequireUserInfo, true}};
    const auto session = KYTReporting::open(std::move(options));
    session->startConfiguration();
    for (int i = 0; i < 10; ++i) EXPECT_TRUE(session->sendMessage(9, 1, Dictionary{{"number", i}}));
    EXPECT_TRUE(session->finish(std::chrono::seconds(20)));
  }
  endDaemon();
  EXPECT_EQ(capture_->peers(), Addresses{kBagServer}) << daemon_->log();
}

TEST_F(Consent, WithItTheSameSessionsReachTheServersThatTheStorebagNames) {
  setConsent(true);
  startDaemon();
  {
    TestClient client(daemon_->socketPath(), kTorvel, "program");
    const std::string live = client.configure();
    EXPECT_NE(live.find(kPosters), std::string::npos) << live;
    report(client, 3);
    EXPECT_TRUE(client.finish());
  }
  endDaemon();
  EXPECT_EQ(capture_->peers(), (Addresses{kBagServer, kEventServer}));
  EXPECT_GT(posts("program"), 0U);
}

// Users tell the phases apart: what is sent for each goes to an address of its own. A back end
// that has posted does not decide again, so the first session sends nothing before the change.
TEST_F(Consent, AChangeCountsForSessionsThatAreConfiguredAfterIt) {
  setConsent(true);
  startDaemon();
  TestClient first(daemon_->socketPath(), kTorvel, "granted", 1);
  EXPECT_NE(first.configure().find(kPosters), std::string::npos);

  setConsent(false);
  TestClient second(daemon_->socketPath(), kTorvel, "withdrawn", 2);
  EXPECT_EQ(second.configure().find(kPosters), std::string::npos);
  report(second, 0);
  EXPECT_NE(states(first, "running").find(kPosters), std::string::npos)
      << "a running session keeps what it read, whoever its user becomes";
  report(first, 0);
  EXPECT_EQ(first.configure().find(kPosters), std::string::npos) << "until it is configured again";
  EXPECT_EQ(states(first, "configured-again").find(kPosters), std::string::npos);
  report(first, 0);

  setConsent(true);
  EXPECT_EQ(states(second, "granted-later").find(kPosters), std::string::npos) << "a grant counts no sooner";
  report(second, 0);
  EXPECT_NE(second.configure().find(kPosters), std::string::npos);
  EXPECT_NE(states(second, "granted-again").find(kPosters), std::string::npos);
  report(second, 0);
  EXPECT_TRUE(first.finish());
  EXPECT_TRUE(second.finish());
  endDaemon();
  EXPECT_EQ(posts("withdrawn"), 0U);
  EXPECT_GT(posts("running"), 0U);
  EXPECT_EQ(posts("configured-again"), 0U);
  EXPECT_EQ(posts("granted-later"), 0U);
  EXPECT_GT(posts("granted-again"), 0U);
}

}  // namespace
}  // namespace kyt
