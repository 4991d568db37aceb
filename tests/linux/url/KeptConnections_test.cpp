// What becomes of requests on a session's kept connections when those end: nothing that a server may have got is sent a
// second time.
#include <curl/curl.h>

#include <sys/syscall.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <map>
#include <mutex>

#include "tests/linux/url/CurlURLSessionFixture.h"
#include "tests/linux/url/Http2Nginx.h"

namespace {
std::atomic<int> sendsThatFail{0};  // of those that are to wait for nothing: libcurl's
}

// In place of the C library's, for libcurl too.
extern "C" ssize_t send(int socket, const void* bytes, size_t size, int flags) {
  const bool fails = sendsThatFail > 0 && sendsThatFail-- > 0;
  if (!fails) return syscall(SYS_sendto, socket, bytes, size, flags, nullptr, 0);
  errno = ENOBUFS;
  return -1;
}

namespace kyt {
namespace {

using namespace std::chrono_literals;
using Behaviour = TestHTTPServer::Behaviour;

// Over plain HTTP, and over TLS.
class KeptConnections : public CurlURLSessionFixture, public testing::WithParamInterface<bool> {
 protected:
  KeptConnections() {
    options_.certificateFile = authority_.file();
    TestHTTPServer::Options options;
    if (GetParam()) options.certificate = authority_.issue();
    server_ = std::make_unique<TestHTTPServer>(std::move(options));
  }
  // The first request of each connection gets an answer; further ones get `behaviour`.
  void answerFirstRequestsAlone(Behaviour behaviour) {
    server_->setHandler([=, this](const TestHTTPServer::Request& request) {
      std::lock_guard lock(mutex_);
      TestHTTPServer::Reply reply;
      if (++requestsOf_[request.connection] > 1) reply.behaviour = behaviour;
      return reply;
    });
  }
  size_t times(const std::string& body) {
    size_t count = 0;
    for (const auto& request : server_->requests()) count += request.body == body ? 1 : 0;
    return count;
  }

  TestCertificateAuthority authority_;
  std::mutex mutex_;
  std::map<size_t, int> requestsOf_;
  std::unique_ptr<TestHTTPServer> server_;  // ends before what its threads use
};

INSTANTIATE_TEST_SUITE_P(PlainAndTLS, KeptConnections, testing::Bool(),
                         [](const auto& tls) { return tls.param ? "TLS" : "Plain"; });

TEST_P(KeptConnections, APostWhoseConnectionEndsUnderItIsReportedAndNotSentAgain) {
  answerFirstRequestsAlone(Behaviour::close);
  auto urls = session(true);
  EXPECT_EQ(perform(*urls, post(server_->url("/"), "one")).status(), 200);
  const Outcome lost = perform(*urls, post(server_->url("/"), "two"));
  EXPECT_EQ(lost.errorCode(), CURLE_GOT_NOTHING);
  EXPECT_EQ(lost.errorText(), "The connection ended without an answer");
  EXPECT_EQ(times("two"), 1u);
  EXPECT_EQ(perform(*urls, post(server_->url("/"), "three")).status(), 200);
  EXPECT_EQ(times("three"), 1u);
  EXPECT_EQ(factory().figures().failed, 1u);
}

// A reset comes before the acknowledgement that the server's TCP still owed.
TEST_P(KeptConnections, AResetProvesNothingSoAPostIsNotSentAgainAfterIt) {
  answerFirstRequestsAlone(Behaviour::reset);
  auto urls = session(true);
  for (int i = 0; i < 20; ++i) {
    EXPECT_EQ(perform(*urls, post(server_->url("/"), "one")).status(), 200);
    EXPECT_NE(perform(*urls, post(server_->url("/"), "two")).errorCode(), 0);
  }
  EXPECT_EQ(times("one"), 20u);
  EXPECT_EQ(times("two"), 20u);
}

TEST_P(KeptConnections, AnUploadIsNotSentAgainEither) {
  answerFirstRequestsAlone(Behaviour::close);
  auto urls = session(true);
  URLRequest request = post(server_->url("/"), std::string(1u << 20, 'u'));
  request.isAwaited = true;
  EXPECT_EQ(perform(*urls, request).status(), 200);
  EXPECT_EQ(perform(*urls, request).errorCode(), CURLE_GOT_NOTHING);
  EXPECT_EQ(server_->requestCount(), 2u);
}

TEST_P(KeptConnections, APostIsSentOnceHoweverManyConnectionsAreKept) {
  constexpr size_t kKept = 6;
  server_->setReply({.behaviour = Behaviour::hold});
  auto urls = session(true);
  std::vector<Outcome> outcomes(kKept);
  for (Outcome& outcome : outcomes) urls->start(post(server_->url("/"), "first"), outcome.completion());
  ASSERT_TRUE(server_->waitForRequests(kKept)) << "each on its own connection";
  server_->release();
  for (Outcome& outcome : outcomes) ASSERT_TRUE(outcome.wait());
  server_->setReply({.behaviour = Behaviour::close});
  EXPECT_EQ(perform(*urls, post(server_->url("/"), "once")).errorCode(), CURLE_GOT_NOTHING);
  EXPECT_EQ(times("once"), 1u);
}

TEST_P(KeptConnections, ARequestThatChangesNothingMayGoAgain) {
  answerFirstRequestsAlone(Behaviour::close);
  auto urls = session();
  for (int i = 0; i < 2; ++i) EXPECT_EQ(perform(*urls, get(server_->url("/"))).status(), 200);
  EXPECT_EQ(server_->requestCount(), 3u);
}

TEST_P(KeptConnections, NothingIsSentOnAConnectionThatItsServerHasEnded) {
  server_->setReply({.behaviour = Behaviour::sayGoodbye});
  auto urls = session(true);
  for (size_t i = 1; i <= 20; ++i) {
    const Outcome outcome = perform(*urls, post(server_->url("/"), "x"));
    EXPECT_EQ(outcome.status(), 200) << outcome.errorText();
  }
  std::map<size_t, int> requests;
  for (const auto& request : server_->requests()) ++requests[request.connection];
  EXPECT_EQ(requests.size(), 20u);
  for (const auto& [connection, count] : requests) EXPECT_EQ(count, 1) << connection;
}

TEST_P(KeptConnections, AnUnansweredRequestDelaysNoOtherOfItsSession) {
  server_->setHandler([](const TestHTTPServer::Request& request) {
    TestHTTPServer::Reply reply;
    if (request.target == "/slow") reply.behaviour = Behaviour::hold;
    return reply;
  });
  auto urls = session(true);
  Outcome slow;
  urls->start(post(server_->url("/slow"), "x"), slow.completion());
  ASSERT_TRUE(server_->waitForRequests(1));
  for (int i = 0; i < 3; ++i) EXPECT_EQ(perform(*urls, post(server_->url("/quick"), "x")).status(), 200);
  EXPECT_FALSE(slow.isDone());
  server_->release();
  EXPECT_TRUE(slow.wait());
}

class NewConnections : public CurlURLSessionFixture {
 protected:
  ~NewConnections() override { sendsThatFail = 0; }
  TestHTTPServer server_;
};

TEST_F(NewConnections, AFailedSendIsMadeGoodOnAnotherOne) {
  auto urls = session(true);
  sendsThatFail = 1;
  const Outcome outcome = perform(*urls, post(server_.url("/"), "x"));
  EXPECT_EQ(outcome.status(), 200) << outcome.errorText();
  EXPECT_EQ(sendsThatFail, 0);
  EXPECT_EQ(server_.requestCount(), 1u);
}

TEST_F(NewConnections, WhereEverySendFailsThePostFailsSoonAndThoseAfterItAreNotDelayed) {
  options_.noProgressTimeout = 10min;
  auto urls = session(true);
  sendsThatFail = 1000;
  EXPECT_NE(perform(*urls, post(server_.url("/"), "one")).errorCode(), 0);
  sendsThatFail = 0;
  EXPECT_EQ(perform(*urls, post(server_.url("/"), "two")).status(), 200);
  EXPECT_EQ(server_.requestCount(), 1u);
}

class KeptHTTP2Connections : public CurlURLSessionFixture {
 protected:
  KeptHTTP2Connections() { options_.certificateFile = authority_.file(); }
  void SetUp() override {
    if (!HTTP2Nginx::isHere()) GTEST_SKIP() << "nginx is not installed";
  }
  TestCertificateAuthority authority_;
  TestHTTPServer behind_;
};

TEST_F(KeptHTTP2Connections, APostWhoseConnectionEndsUnderItIsReportedAndNotSentAgain) {
  const HTTP2Nginx nginx(authority_.folder(), authority_.issue(), behind_.url(""));
  auto urls = session(true);
  EXPECT_EQ(perform(*urls, post(nginx.url(), "one")).status(), 200);
  behind_.setReply({.behaviour = Behaviour::hold});
  std::vector<Outcome> lost(3);
  for (Outcome& outcome : lost) urls->start(post(nginx.url(), "two"), outcome.completion());
  ASSERT_TRUE(behind_.waitForRequests(4));
  ASSERT_TRUE(nginx.killWorker());
  for (Outcome& outcome : lost) {
    ASSERT_TRUE(outcome.wait()) << "it is sent again";
    EXPECT_NE(outcome.errorCode(), 0);
  }
  EXPECT_EQ(behind_.requestCount(), 4u);
  behind_.setReply({});
  EXPECT_EQ(perform(*urls, post(nginx.url(), "three")).status(), 200);
}

TEST_F(KeptHTTP2Connections, AServersLimitOfRequestsToAConnectionLosesNoneAndRepeatsNone) {
  const HTTP2Nginx nginx(authority_.folder(), authority_.issue(), behind_.url(""), "127.0.0.1",
                         "keepalive_requests 3;\n");
  auto urls = session(true);
  for (size_t i = 1; i <= 20; ++i) {
    const Outcome outcome = perform(*urls, post(nginx.url(), "x"));
    EXPECT_EQ(outcome.status(), 200) << outcome.errorText();
    EXPECT_EQ(behind_.requestCount(), i);
  }
}

}  // namespace
}  // namespace kyt
