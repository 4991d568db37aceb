// Requests that share one HTTP/2 connection, and a server that ends some of them, or the connection, at the wrong moment:
// nothing that it may have got is sent a second time, and what happens to one request costs no other its answer.
#include <curl/curl.h>

#include <filesystem>
#include <fstream>

#include "tests/linux/url/CurlURLSessionFixture.h"
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

// That the network thread has used.
std::chrono::nanoseconds processorTime() {
  for (const auto& task : std::filesystem::directory_iterator("/proc/self/task")) {
    std::ifstream called(task.path() / "comm"), used(task.path() / "schedstat");
    std::string name;
    int64_t nanoseconds = 0;
    if (std::getline(called, name) && name == "kyt-network" && used >> nanoseconds)
      return std::chrono::nanoseconds(nanoseconds);
  }
  return {};
}

TEST_F(HTTP2Streams, AServerThatTakesNoBodyCostsNoProcessorTimeAndGetsItWhenItDoes) {
  TestHTTP2Server server(with());
  auto urls = session(true);
  ASSERT_EQ(perform(*urls, post(server.url(), "first")).status(), 200);
  const auto setWindow = [&](uint8_t kibibytes) {
    const char setting[] = {0, 4, 0, 0, static_cast<char>(kibibytes << 2), 0};
    server.forEachConnection([&](Connection& connection) {
      connection.frame(TestHTTP2Server::kSettings, 0, 0, std::string(setting, sizeof setting));
    });
  };
  setWindow(0);
  ASSERT_EQ(perform(*urls, get(server.url())).status(), 200) << "it knows of the window";
  std::vector<Outcome> outcomes(4);
  for (Outcome& outcome : outcomes) urls->start(post(server.url(), "body"), outcome.completion());
  const auto before = processorTime();
  EXPECT_FALSE(outcomes[0].wait(2s));
  EXPECT_LT(processorTime() - before, 100ms);
  const auto start = std::chrono::steady_clock::now();
  setWindow(16);
  for (Outcome& outcome : outcomes) {
    ASSERT_TRUE(outcome.wait());
    EXPECT_EQ(outcome.status(), 200) << outcome.errorText();
  }
  EXPECT_LT(std::chrono::steady_clock::now() - start, 5s);
  EXPECT_EQ(server.times("body"), 4u);
  EXPECT_EQ(server.connectionsAccepted(), 1u);
}

// It has a window for a part of it.
TEST_F(HTTP2Streams, AServerThatTakesABodySlowlyCostsNoProcessorTime) {
  auto options = with();
  options.greet = [](Connection& connection) {
    connection.allowStreams(100);
    return false;
  };
  TestHTTP2Server server(options);
  auto urls = session(true);
  Outcome outcome;
  urls->start(post(server.url(), std::string(70000, 'b')), outcome.completion());
  ASSERT_TRUE(eventually([&] { return server.connectionsAccepted() == 1; }));
  EXPECT_FALSE(outcome.wait(500ms));
  const auto before = processorTime();
  EXPECT_FALSE(outcome.wait(2s));
  EXPECT_LT(processorTime() - before, 100ms);
  server.forEachConnection([](Connection& connection) {
    for (const uint32_t stream : {0u, 1u}) {
      const char bytes[] = {0, 1, 0, 0};
      connection.frame(TestHTTP2Server::kWindow, 0, stream, std::string(bytes, sizeof bytes));
    }
  });
  ASSERT_TRUE(outcome.wait());
  EXPECT_EQ(outcome.status(), 200) << outcome.errorText();
}

}  // namespace
}  // namespace kyt
