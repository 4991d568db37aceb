// The site for nginx that the packages bring, in a real nginx: what of its own failures, limits and choices a device meets.
#include "tools/fleet/Front.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <optional>
#include <sstream>
#include <string>

#include "tests/support/Programs.h"
#include "tests/support/TemporaryFolder.h"
#include "tests/support/TestCertificates.h"
#include "tests/support/TestHTTPServer.h"

namespace kyt {
namespace {

// Nobody listens on the discard port of the loopback here.
constexpr uint16_t kNobody = 9;

class FrontTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (!isInstalled("nginx")) GTEST_SKIP() << "nginx is not installed";
    const TestCertificate certificate = authority_.issue();
    options_.folder = folder_.path();
    options_.site = KYT_FLEET_FILES "/nginx-site.conf";
    options_.certificate = folder_.write("certificate.pem", certificate.certificatePEM);
    options_.key = folder_.write("key.pem", certificate.keyPEM, 0600);
  }
  void start(std::vector<uint16_t> receivers) {
    options_.receivers = std::move(receivers);
    auto started = tools::Front::start(options_);
    ASSERT_TRUE(std::holds_alternative<tools::Front>(started))
        << std::get<Error>(started).localizedDescription << folder_.read("error.log")
        << folder_.read("output");
    front_.emplace(std::get<tools::Front>(std::move(started)));
  }
  // The status of a post of so many bytes, or what curl says of its failure.
  [[nodiscard]] std::string post(size_t bytes = 100, std::vector<std::string> further = {}) const {
    const std::string body = folder_.path() + "/body-to-send";
    std::ofstream(body, std::ios::binary) << std::string(bytes, 'x');
    std::vector<std::string> arguments = {
        "-sS", "--cacert", authority_.file(), "-o",      "/dev/null", "-w", "%{http_code}",
        "-H",  "Expect:",  "--data-binary",   "@" + body};
    arguments.insert(arguments.end(), further.begin(), further.end());
    arguments.push_back(front_->base() + "/v1/events");
    return runProgram("curl", arguments).text;
  }
  static void answer(TestHTTPServer& server, int status,
                     TestHTTPServer::Behaviour behaviour = TestHTTPServer::Behaviour::answer) {
    TestHTTPServer::Reply reply;
    reply.status = status;
    reply.behaviour = behaviour;
    server.setReply(reply);
  }

  TestCertificateAuthority authority_;
  TemporaryFolder folder_;
  tools::FrontOptions options_;
  std::optional<tools::Front> front_;
};

TEST_F(FrontTest, IsGoodInTheEyesOfNginx) {
  options_.receivers = {8480, 8481};
  const auto [isGood, said] = tools::Front::check(options_);
  EXPECT_TRUE(isGood) << said;
  EXPECT_NE(said.find("test is successful"), std::string::npos) << said;
  EXPECT_EQ(said.find("[warn]"), std::string::npos) << said;
}

TEST_F(FrontTest, Answers429WhereNoReceiverIsThere) {
  start({kNobody, kNobody});
  EXPECT_EQ(post(), "429");
  EXPECT_EQ(post(), "429") << "both count as failed now";
}

TEST_F(FrontTest, TurnsToTheNextReceiverWhereOneIsAwayOrDiesUnderThePost) {
  TestHTTPServer good, dying;
  answer(good, 200);
  answer(dying, 200, TestHTTPServer::Behaviour::close);
  start({kNobody, good.port()});
  for (int i = 0; i < 4; ++i) EXPECT_EQ(post(), "200");
  start({dying.port(), good.port()});
  for (int i = 0; i < 4; ++i) EXPECT_EQ(post(), "200");
  EXPECT_GE(dying.requestCount(), 1U) << "it had read one";
  EXPECT_EQ(good.requestCount(), 8U);
}

TEST_F(FrontTest, LetsWhatReceiversAnswerThrough) {
  TestHTTPServer receiver;
  start({receiver.port()});
  for (const int status : {200, 400, 429, 503}) {
    answer(receiver, status);
    EXPECT_EQ(post(), std::to_string(status));
  }
}

TEST_F(FrontTest, Answers429WhereReceiversBreakOff) {
  TestHTTPServer receiver;
  answer(receiver, 200, TestHTTPServer::Behaviour::close);
  start({receiver.port()});
  EXPECT_EQ(post(), "429");
}

TEST_F(FrontTest, Refuses18MiBAndPassesOn16) {
  TestHTTPServer receiver;
  answer(receiver, 200);
  start({receiver.port()});
  EXPECT_EQ(post(16u << 20), "200");
  ASSERT_EQ(receiver.requestCount(), 1U);
  EXPECT_EQ(receiver.requests()[0].body.size(), 16u << 20);
  EXPECT_TRUE(post(18u << 20).ends_with("413"));
  EXPECT_EQ(receiver.requestCount(), 1U);
}

TEST_F(FrontTest, SpeaksTLS13WithECDSAAlone) {
  TestHTTPServer receiver;
  answer(receiver, 200);
  start({receiver.port()});
  EXPECT_TRUE(post(100, {"--tls-max", "1.2"}).ends_with("000"));
  const std::string said =
      runProgram("sh", {"-c", "openssl s_client -connect 127.0.0.1:" + std::to_string(front_->port()) +
                                  " </dev/null"})
          .text;
  EXPECT_NE(said.find("TLSv1.3"), std::string::npos) << said;
  EXPECT_NE(said.find("Peer signature type: ECDSA"), std::string::npos) << said;
}

TEST_F(FrontTest, ShowsReceiversNoSlowBody) {
  TestHTTPServer receiver;
  answer(receiver, 200);
  start({receiver.port()});
  EXPECT_TRUE(post(200000, {"--limit-rate", "1000", "--max-time", "3"}).ends_with("000")) << "curl gave up";
  EXPECT_EQ(post(), "200");
  EXPECT_EQ(receiver.requestCount(), 1U);
}

}  // namespace
}  // namespace kyt
