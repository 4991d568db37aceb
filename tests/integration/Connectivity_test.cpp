// The whole daemon in a network of its own that the tests cut and restore: what waits for a route, and what waits for
// another network than the cellular one.
#include <grp.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>

#include "tests/integration/DaemonProcess.h"
#include "tests/integration/TestClient.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/NetworkNamespace.h"
#include "tests/support/PlainClient.h"
#include "tests/support/TestHTTPServer.h"

namespace kyt {
namespace {

constexpr int kTorvel = 5;

// The daemon's network and the server's. The server's address lies behind a route by way of "wwan0" ("cellular") or
// "eth7", both cables to the same machine.
class Connectivity : public ::testing::Test {
 protected:
  void SetUp() override {
    if (!NetworkNamespace::isPermitted()) GTEST_SKIP() << "network namespaces need root";
    here_.emplace();
    there_.emplace();
    ASSERT_TRUE(here_->connect("eth7", "10.77.0.2/24", *there_, "eth8", "10.77.0.1/24"));
    ASSERT_TRUE(here_->connect("wwan0", "10.79.0.2/24", *there_, "eth9", "10.79.0.1/24"));
    ASSERT_TRUE(there_->run("ip addr add 10.78.0.1/24 dev eth8"));
    server_ = TestHTTPServer::in(*there_, "10.78.0.1");
    daemon_.emplace(base());
  }
  void TearDown() override {
    if (!started_) return;
    daemon_->terminate();
    EXPECT_EQ(daemon_->exitStatus(), 0) << daemon_->log();
  }
  [[nodiscard]] std::string base() const { return "http://10.78.0.1:" + std::to_string(server_->port()); }
  void startDaemon(const std::string& moreSettings = {}) {
    daemon_->root().write("etc/kytreportingd/device.toml", "ReleaseType = \"Internal\"\ncountry = \"DE\"\n");
    daemon_->root().write("var/lib/kytreportingd/defaults/com.vantu.diagnostics.toml", "consent = true\n");
    daemon_->writeSettings("[storebag]\ninternal_host = \"" + base() + "\"\npublic_host = \"" + base() +
                           "\"\n[log]\ntarget = \"stderr\"\n" + moreSettings);
    const NetworkNamespace::Entered entered(*here_);
    started_ = daemon_->startAndWait();
    ASSERT_TRUE(started_) << daemon_->log();
  }
  void serveBag(bool wifiOnly) {
    const auto entry = [&](const char* name, bool only) {
      return Dictionary{{"client", name},
                        {"locale_whitelist", Array{"DE"}},
                        {"filters", Array{}},
                        {"sampling_threshold", 1.0},
                        {"event_threshold", 1000},
                        {"use_wifi_only", only ? 1 : 0},
                        {"post_url", base() + "/events/" + name}};
    };
    const Dictionary backend{{"clients", Array{entry("choosy", wifiOnly), entry("plain", false)}}};
    server_->setHandler(
        [document =
             signedBag(Dictionary{{"version", "1"}, {"vantu_internal", Dictionary{{"httppost", backend}}}},
                       propertyLists_)](const TestHTTPServer::Request& request) {
          TestHTTPServer::Reply reply;
          if (request.method == "GET") reply.body = document;
          return reply;
        });
  }
  bool route(const char* change, const char* interface) {
    const std::string gateway = interface == std::string("wwan0") ? "10.79.0.1" : "10.77.0.1";
    return here_->run(std::string("ip route ") + change + " 10.78.0.0/24 via " + gateway + " dev " +
                      interface);
  }
  // How often something in the daemon's network found no route, by the kernel's count.
  long refusedByTheKernel() {
    const NetworkNamespace::Entered entered(*here_);
    std::ifstream file("/proc/thread-self/net/snmp");
    std::string names, values;
    while (std::getline(file, names) && std::getline(file, values) && names.rfind("Ip:", 0) != 0) {
    }
    std::istringstream name(names), value(values);
    for (std::string n, v; name >> n && value >> v;)
      if (n == "OutNoRoutes") return std::stol(v);
    return -1;
  }
  size_t posts(const std::string& client) {
    size_t count = 0;
    for (const auto& request : server_->requests())
      count += request.method == "POST" && request.target == "/events/" + client ? 1 : 0;
    return count;
  }
  static bool isOpen(const std::shared_future<std::string>& answer) {
    return answer.wait_for(std::chrono::seconds(0)) != std::future_status::ready;
  }

  PugixmlPropertyLists propertyLists_;
  std::optional<NetworkNamespace> here_, there_;
  std::unique_ptr<TestHTTPServer> server_;
  std::optional<DaemonProcess> daemon_;
  bool started_ = false;
};

TEST_F(Connectivity, EventsWaitWhileThereIsNoRouteAndArriveWhenItIsBack) {
  ASSERT_TRUE(route("add", "eth7"));
  serveBag(false);
  startDaemon();
  ASSERT_TRUE(there_->run("ip route add default via 10.77.0.2"));
  TestClient client(daemon_->socketPath(), kTorvel, "plain");
  ASSERT_EQ(client.configure(), "live: httppost") << daemon_->log();
  ASSERT_TRUE(route("del", "eth7"));
  server_->closeConnections();
  ASSERT_TRUE(server_->waitForConnectionsOpen(0));
  for (int i = 0; i < 3; ++i) {
    const long refused = refusedByTheKernel();
    ASSERT_GE(refused, 0);
    EXPECT_TRUE(client.send(9, 1, Dictionary{{"number", i}}));
    const std::shared_future<std::string> answer = client.startFlush()->get_future().share();
    ASSERT_TRUE(eventually([&] { return refusedByTheKernel() > refused; })) << "the daemon tried";
    EXPECT_NE(client.displayURL(), "no answer") << "the session goes on";
    EXPECT_TRUE(isOpen(answer));
    EXPECT_EQ(posts("plain"), static_cast<size_t>(i));
    ASSERT_TRUE(route("add", "eth7"));
    ASSERT_EQ(answer.wait_for(kTestDeadline), std::future_status::ready);
    EXPECT_EQ(answer.get(), "flushed");
    EXPECT_EQ(posts("plain"), static_cast<size_t>(i) + 1);
    ASSERT_TRUE(route("del", "eth7"));
    server_->closeConnections();
    ASSERT_TRUE(server_->waitForConnectionsOpen(0));
  }
  ASSERT_TRUE(route("add", "eth7"));
}

TEST_F(Connectivity, AnOutboxKeepsAtOnceWhatFindsNoRouteAndSendsItWhenThereIsOne) {
  ASSERT_TRUE(route("add", "eth7"));
  serveBag(false);
  startDaemon("[outbox]\nenabled = true\n");
  ASSERT_TRUE(there_->run("ip route add default via 10.77.0.2"));
  TestClient client(daemon_->socketPath(), kTorvel, "plain");
  ASSERT_EQ(client.configure(), "live: httppost") << daemon_->log();
  ASSERT_TRUE(route("del", "eth7"));
  server_->closeConnections();
  ASSERT_TRUE(server_->waitForConnectionsOpen(0));
  for (int i = 0; i < 3; ++i) {
    EXPECT_TRUE(client.send(9, 1, Dictionary{{"number", i}}));
    EXPECT_EQ(client.flush(), "flushed") << daemon_->log();
  }
  EXPECT_EQ(posts("plain"), 0U);
  ASSERT_TRUE(route("add", "eth7"));
  EXPECT_TRUE(eventually([&] { return posts("plain") == 3; })) << daemon_->log();
}

// The server knows nothing of it and keeps its connections.
TEST_F(Connectivity, EventsWaitAlsoWhereAConnectionIsKeptAndArriveOnceFromAnotherAddress) {
  ASSERT_TRUE(route("add", "eth7"));
  serveBag(false);
  startDaemon();
  ASSERT_TRUE(there_->run("ip route add default via 10.77.0.2"));
  TestClient client(daemon_->socketPath(), kTorvel, "plain");
  ASSERT_EQ(client.configure(), "live: httppost") << daemon_->log();
  EXPECT_TRUE(client.send(9, 1, Dictionary{{"number", 0}}));
  EXPECT_EQ(client.flush(), "flushed") << daemon_->log();
  ASSERT_TRUE(route("del", "eth7"));
  const long refused = refusedByTheKernel();
  EXPECT_TRUE(client.send(9, 1, Dictionary{{"number", 1}}));
  const std::shared_future<std::string> answer = client.startFlush()->get_future().share();
  ASSERT_TRUE(eventually([&] { return refusedByTheKernel() > refused; })) << "the daemon tried";
  EXPECT_TRUE(isOpen(answer));
  ASSERT_TRUE(here_->run("ip addr del 10.77.0.2/24 dev eth7 && ip addr add 10.77.0.3/24 dev eth7"));
  ASSERT_TRUE(route("add", "eth7"));
  ASSERT_EQ(answer.wait_for(kTestDeadline), std::future_status::ready);
  EXPECT_EQ(answer.get(), "flushed") << daemon_->log();
  EXPECT_TRUE(client.send(9, 1, Dictionary{{"number", 2}}));
  EXPECT_EQ(client.flush(), "flushed") << daemon_->log();
  EXPECT_EQ(posts("plain"), 3U);
  EXPECT_EQ(server_->requests().back().peer, "10.77.0.3");
}

TEST_F(Connectivity, EventsThatMayNotUseACellularInterfaceWaitForAnother) {
  ASSERT_TRUE(route("add", "wwan0"));
  ASSERT_TRUE(there_->run("ip route add default via 10.79.0.2"));
  serveBag(true);
  startDaemon("[network]\ncellular_interfaces = [\"wwan*\"]\n");
  TestClient choosy(daemon_->socketPath(), kTorvel, "choosy"), plain(daemon_->socketPath(), kTorvel, "plain");
  ASSERT_EQ(choosy.configure(), "live: httppost") << "a bag comes by any network" << daemon_->log();
  ASSERT_EQ(plain.configure(), "live: httppost");
  EXPECT_TRUE(choosy.send(9, 1, Dictionary{{"k", 1}}));
  const std::shared_future<std::string> answer = choosy.startFlush()->get_future().share();
  // Answered after the flush was handed over.
  EXPECT_NE(choosy.displayURL(), "no answer");
  EXPECT_TRUE(plain.send(9, 1, Dictionary{{"k", 1}}));
  EXPECT_EQ(plain.flush(), "flushed") << daemon_->log();
  EXPECT_EQ(posts("plain"), 1U);
  EXPECT_TRUE(isOpen(answer));
  EXPECT_EQ(posts("choosy"), 0U);

  ASSERT_TRUE(route("replace", "eth7"));
  ASSERT_EQ(answer.wait_for(kTestDeadline), std::future_status::ready);
  EXPECT_EQ(answer.get(), "flushed") << daemon_->log();
  EXPECT_EQ(posts("choosy"), 1U);
}

TEST_F(Connectivity, WhatStillWaitsIsGivenUpWhenTheDaemonEnds) {
  ASSERT_TRUE(route("add", "eth7"));
  ASSERT_TRUE(there_->run("ip route add default via 10.77.0.2"));
  serveBag(false);
  startDaemon("[service]\nshutdown_grace_seconds = 0.5\n");
  TestClient client(daemon_->socketPath(), kTorvel, "plain");
  ASSERT_EQ(client.configure(), "live: httppost") << daemon_->log();
  ASSERT_TRUE(route("del", "eth7"));
  server_->closeConnections();
  ASSERT_TRUE(server_->waitForConnectionsOpen(0));
  EXPECT_TRUE(client.send(9, 1, Dictionary{{"k", 1}}));
  const auto begin = std::chrono::steady_clock::now();
  daemon_->terminate();
  EXPECT_EQ(daemon_->exitStatus(), 0);
  EXPECT_LT(std::chrono::steady_clock::now() - begin, std::chrono::seconds(20)) << "it would wait for ever";
  EXPECT_TRUE(daemon_->logged("shutDown: Cancelling 1 requests that have not been answered in time"))
      << daemon_->log();
  started_ = false;
}

// They share one connection pool, but neither what may wait nor what may be unanswered.
TEST_F(Connectivity, SingleMessagesOfOneUserDoNotDisplaceAnothersWhileThereIsNoRoute) {
  constexpr uid_t kNobody = 65534;
  ASSERT_TRUE(route("add", "eth7"));
  serveBag(false);
  daemon_->root().write(
      "etc/kytreportingd/entitlements.d/nobody.toml",
      "[[grant]]\nuser = " + std::to_string(kNobody) + "\n\"com.vantu.private.kytreportingd\" = true\n");
  startDaemon();
  std::filesystem::permissions(daemon_->root().path(), std::filesystem::perms(0755));
  ASSERT_TRUE(there_->run("ip route add default via 10.77.0.2"));
  const auto sendSingle = [](test::PlainClient& client, uint32_t bytes) {
    std::string noise(bytes, 'x');  // that gzip cannot make small
    uint32_t state = 1;
    for (char& c : noise) {
      state = state * 1664525 + 1013904223;
      c = static_cast<char>('0' + (state >> 24) % 64);
    }
    client.call("SendMessageWithSessionInfo", "a{sv}aa{sv}qqaa{sv}", [&](MessageWriter& out) {
      out.writeDictionary(Dictionary{{kKYTReportingSessionInfoSessionID, 1},
                                     {kKYTReportingSessionInfoClientType, kTorvel},
                                     {kKYTReportingSessionInfoRequireUserInfo, true}});
      out.writeOptionalDictionary(
          Dictionary{{kKYTReportingUserInfoClientName, "plain"}, {kKYTReportingUserInfoServiceName, "test"}});
      out.writeUInt16(10);
      out.writeUInt16(1);
      out.writeOptionalDictionary(Dictionary{{"t", noise}});
    });
    return client.receiveText();
  };
  test::PlainClient victim(daemon_->socketPath());
  ASSERT_TRUE(victim.shakeHands());
  ASSERT_EQ(sendSingle(victim, 100), "finished");
  ASSERT_TRUE(eventually([&] { return posts("plain") == 1; })) << daemon_->log();
  ASSERT_TRUE(route("del", "eth7"));
  server_->closeConnections();
  for (int i = 0; i < 5; ++i) ASSERT_EQ(sendSingle(victim, 100), "finished");
  const std::string failure = inChildProcess([&]() -> std::string {
    if (::setgroups(0, nullptr) != 0 || ::setgid(kNobody) != 0 || ::setuid(kNobody) != 0)
      return "no other user";
    test::PlainClient hostile(daemon_->socketPath());
    if (!hostile.shakeHands()) return "refused";
    for (int i = 0; i < 40; ++i)
      if (sendSingle(hostile, 900000) != "finished") return "not finished";
    return "";
  });
  EXPECT_EQ(failure, "");
  EXPECT_TRUE(eventually([&] {
    return daemon_->logged("bytes wait for connectivity, dropping the oldest request");
  })) << daemon_->log();
  ASSERT_TRUE(route("add", "eth7"));
  const auto small = [&] {
    size_t count = 0;
    for (const auto& request : server_->requests())
      count += request.method == "POST" && request.body.size() < 10000 ? 1 : 0;
    return count;
  };
  EXPECT_TRUE(eventually([&] { return small() == 6; })) << small();
}

}  // namespace
}  // namespace kyt
