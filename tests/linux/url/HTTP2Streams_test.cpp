// Requests that share one HTTP/2 connection, and a server that ends some of them, or the connection, at the wrong moment:
// nothing that it may have got is sent a second time, and what happens to one request costs no other its answer.
#include <curl/curl.h>

#include <cstdio>
#include <fstream>
#include <sstream>

#include "tests/linux/url/CurlUrlSessionFixture.h"
#include "tests/support/TestHTTP2Server.h"

namespace kyt {
namespace {

using namespace std::chrono_literals;
using Connection = TestHTTP2Server::Connection;
using Request = TestHTTP2Server::Request;

class HTTP2Streams : public CurlURLSessionFixture {
 protected:
  HTTP2Streams() { options_.certificateFile = authority_.file(); }
  TestHTTP2Server::Options with() {
    TestHTTP2Server::Options options;
    options.certificate = authority_.issue();
    return options;
  }
  // Of the connections to that port, by the kernel's table.
  static bool hasUnacknowledged(uint16_t port) {
    char peersPort[8];
    std::snprintf(peersPort, sizeof peersPort, ":%04X", port);
    std::ifstream file("/proc/thread-self/net/tcp");
    std::string number, local, peer, is, queues;
    for (std::string line; std::getline(file, line);) {
      std::istringstream(line) >> number >> local >> peer >> is >> queues;
      if (peer.ends_with(peersPort) && !queues.starts_with("00000000")) return true;
    }
    return false;
  }
  TestCertificateAuthority authority_;
};

// As in a server's graceful restart: it says up to which request it goes, while another one is under way to it.
TEST_F(HTTP2Streams, ARequestThatCrossesAServersFarewellCostsThoseBeforeItNoAnswer) {
  TestHTTP2Server server(with());
  server.setHandler([](Connection& connection, const Request& request) {
    if (request.body != "held") connection.answer(request.stream);
  });
  auto urls = session(true);
  std::vector<Outcome> held(2);
  for (Outcome& outcome : held) urls->start(post(server.url(), "held"), outcome.completion());
  ASSERT_TRUE(server.waitForRequests(2));
  ASSERT_EQ(server.connectionsAccepted(), 1u);
  ASSERT_TRUE(eventually([&] { return !hasUnacknowledged(server.port()); }));
  server.forEachConnection([](Connection& connection) { connection.loseWhatComes(true); });
  Outcome crossing;
  urls->start(post(server.url(), "crossing"), crossing.completion());
  ASSERT_TRUE(eventually([&] { return hasUnacknowledged(server.port()); }));
  server.forEachConnection([](Connection& connection) { connection.goAway(3); });
  EXPECT_FALSE(held[0].wait(1s)) << held[0].errorText();
  EXPECT_FALSE(crossing.isDone()) << crossing.errorText();
  for (uint32_t stream : {1u, 3u}) {
    server.forEachConnection([=](Connection& connection) { connection.answer(stream); });
    const Outcome& outcome = held[stream / 2];
    ASSERT_TRUE(outcome.wait());
    EXPECT_EQ(outcome.status(), 200) << outcome.errorText();
  }
  ASSERT_TRUE(crossing.wait());
  EXPECT_EQ(crossing.status(), 200) << crossing.errorText();
  EXPECT_EQ(server.times("crossing"), 1u);
  EXPECT_EQ(server.connectionsAccepted(), 2u);
}

// What the server's TCP has acknowledged in the meantime it may have.
TEST_F(HTTP2Streams, ARequestThatCrossesAServersFarewellAndArrivesLateIsReported) {
  TestHTTP2Server server(with());
  server.setHandler([](Connection&, const Request&) {});
  auto urls = session(true);
  Outcome held, crossing;
  urls->start(post(server.url(), "held"), held.completion());
  ASSERT_TRUE(server.waitForRequests(1));
  ASSERT_TRUE(eventually([&] { return !hasUnacknowledged(server.port()); }));
  server.forEachConnection([](Connection& connection) { connection.loseWhatComes(true); });
  urls->start(post(server.url(), "crossing"), crossing.completion());
  ASSERT_TRUE(eventually([&] { return hasUnacknowledged(server.port()); }));
  server.forEachConnection([](Connection& connection) { connection.goAway(1); });
  EXPECT_FALSE(crossing.wait(500ms));
  server.forEachConnection([](Connection& connection) { connection.loseWhatComes(false); });
  ASSERT_TRUE(crossing.wait());
  EXPECT_NE(crossing.errorCode(), 0);
  EXPECT_FALSE(held.isDone());
  server.forEachConnection([](Connection& connection) { connection.answer(1); });
  ASSERT_TRUE(held.wait());
  EXPECT_EQ(held.status(), 200) << held.errorText();
  EXPECT_EQ(server.times("crossing"), 1u);
  EXPECT_EQ(factory().figures().failed, 1u);
}

}  // namespace
}  // namespace kyt
