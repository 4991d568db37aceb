// How many connections are made to a TLS server that speaks HTTP/1.1, and which of them take a TLS session up again.
#include <filesystem>
#include <vector>

#include "tests/linux/url/CurlURLSessionFixture.h"

namespace kyt {
namespace {

using Behaviour = TestHTTPServer::Behaviour;

class TLSConnections : public CurlURLSessionFixture, public testing::WithParamInterface<int> {
 protected:
  TLSConnections() {
    options_.certificateFile = authority_.file();
    options_.connectionPatience = std::chrono::hours(1);  // no test waits for it but where it says so
  }
  static TestHTTPServer::Options with(TestCertificate certificate) {
    TestHTTPServer::Options options;
    options.certificate = std::move(certificate);
    options.maximumTLSVersion = GetParam();
    return options;
  }
  URLRequest postAs(const std::string& identity) {
    URLRequest request = post(server_.url("/"), "x");
    request.identity = identity;
    return request;
  }
  void postOnceAs(const std::string& identity) {
    EXPECT_EQ(perform(*session(), postAs(identity)).status(), 200);
  }
  TestCertificateAuthority authority_;
  TestHTTPServer server_{with(authority_.issue())};
};

INSTANTIATE_TEST_SUITE_P(Versions, TLSConnections, testing::Values(0, 0x0303),
                         [](const auto& version) { return version.param == 0 ? "TLS13" : "TLS12"; });

TEST_P(TLSConnections, ABurstOfOneSessionSharesOneThatIsKept) {
  auto urls = session();
  for (int burst = 0; burst < 3; ++burst) {
    std::vector<Outcome> outcomes(20);
    for (Outcome& outcome : outcomes) urls->start(postAs("device"), outcome.completion());
    for (Outcome& outcome : outcomes) ASSERT_TRUE(outcome.wait());
  }
  EXPECT_EQ(server_.requestCount(), 60u);
  EXPECT_EQ(server_.connectionsAccepted(), 1u);
  EXPECT_EQ(server_.handshakes(), 1u);
}

TEST_P(TLSConnections, MoreAreMadeWhereTheServerDoesNotAnswer) {
  options_.connectionPatience = std::chrono::milliseconds(1);
  server_.setReply({.behaviour = Behaviour::hold});
  auto urls = session();
  std::vector<Outcome> outcomes(20);
  for (Outcome& outcome : outcomes) urls->start(postAs("device"), outcome.completion());
  EXPECT_TRUE(server_.waitForRequests(8));
  EXPECT_EQ(server_.connectionsAccepted(), 8u);
  server_.release();
  for (Outcome& outcome : outcomes) {
    ASSERT_TRUE(outcome.wait());
    EXPECT_EQ(outcome.status(), 200);
  }
  EXPECT_EQ(server_.connectionsAccepted(), 8u);
}

TEST_P(TLSConnections, ASessionThatHasEndedKeepsItsOwnWhileItsRequestsStandInLine) {
  options_.maxActiveRequestsToOneServer = 1;
  auto urls = session();
  std::vector<Outcome> outcomes(10);
  for (Outcome& outcome : outcomes) urls->start(postAs("device"), outcome.completion());
  urls->finishTasksAndInvalidate();
  for (Outcome& outcome : outcomes) {
    ASSERT_TRUE(outcome.wait());
    EXPECT_EQ(outcome.status(), 200);
  }
  EXPECT_EQ(server_.connectionsAccepted(), 1u);
  EXPECT_TRUE(server_.waitForConnectionsOpen(0));
}

TEST_P(TLSConnections, TakeUpTheSessionThatAnotherOfTheSameIdentityHad) {
  for (int i = 0; i < 5; ++i) postOnceAs("device");
  EXPECT_EQ(server_.handshakes(), 5u);
  EXPECT_EQ(server_.resumedHandshakes(), 4u);
}

TEST_P(TLSConnections, TakeUpNoSessionOfAnotherIdentity) {
  for (const char* identity : {"device", "program", "other"}) postOnceAs(identity);
  EXPECT_EQ(server_.handshakes(), 3u);
  EXPECT_EQ(server_.resumedHandshakes(), 0u);
  postOnceAs("program");
  EXPECT_EQ(server_.resumedHandshakes(), 1u);
}

TEST_P(TLSConnections, OfRequestsWithoutAnIdentityTakeUpNoneOfAnotherURLSession) {
  postOnceAs("device");
  for (int i = 0; i < 3; ++i) postOnceAs("");
  EXPECT_EQ(server_.handshakes(), 4u);
  EXPECT_EQ(server_.resumedHandshakes(), 0u);
}

TEST_P(TLSConnections, OfRequestsWithoutAnIdentityTakeUpThoseOfTheirOwnURLSession) {
  server_.setReply({.headers = {{"Connection", "close"}}});
  auto urls = session();
  for (int i = 0; i < 3; ++i) EXPECT_EQ(perform(*urls, postAs("")).status(), 200);
  EXPECT_EQ(server_.handshakes(), 3u);
  EXPECT_EQ(server_.resumedHandshakes(), 2u);
}

TEST_P(TLSConnections, TakeUpNoSessionOnceTheAuthoritiesHaveChanged) {
  postOnceAs("device");
  std::filesystem::copy_file(authority_.file(), authority_.folder() + "/next.pem");
  std::filesystem::rename(authority_.folder() + "/next.pem", authority_.file());
  postOnceAs("device");
  EXPECT_EQ(server_.handshakes(), 2u);
  EXPECT_EQ(server_.resumedHandshakes(), 0u);
  postOnceAs("device");
  EXPECT_EQ(server_.resumedHandshakes(), 1u);
}

}  // namespace
}  // namespace kyt
