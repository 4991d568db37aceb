// The site for nginx that the packages bring, in a real nginx: what of its own failures, limits and choices a device meets.
#include "tools/fleet/Front.h"

#include <gtest/gtest.h>
#include <sys/mount.h>

#include <filesystem>
#include <fstream>
#include <iterator>
#include <optional>
#include <string>
#include <utility>

#include "tests/support/ChildProcess.h"
#include "tests/support/Eventually.h"
#include "tests/support/Programs.h"
#include "tests/support/TemporaryFolder.h"
#include "tests/support/TestCertificates.h"
#include "tests/support/TestHTTPServer.h"

namespace kyt {
namespace {

// Nobody listens on the discard port of the loopback here.
constexpr uint16_t kNobody = 9;
// Of a post that receivers of a test do not answer.
constexpr size_t kOddSize = 4321;

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
  // From here on the site is another in one place.
  void changeSite(const std::string& what, const std::string& by) {
    std::ifstream file(options_.site);
    std::string site(std::istreambuf_iterator<char>(file), {});
    const size_t at = site.find(what);
    ASSERT_NE(at, std::string::npos) << what;
    options_.site = folder_.write("changed-site", site.replace(at, what.size(), by));
  }
  // A client that sends a post's headers and half its body, and then waits for the connection's end.
  [[nodiscard]] tools::ChildProcess startHalfAPost() {
    tools::ChildProcess::Options how;
    how.inputFile = folder_.write("half-" + std::to_string(++halfPosts_),
                                  "POST /v1/events HTTP/1.1\r\nHost: events.example.org\r\n"
                                  "Content-Length: 1000\r\n\r\n" +
                                      std::string(500, 'x'));
    how.outputFile = "/dev/null";
    auto client = tools::ChildProcess::start(
        "openssl", {"s_client", "-quiet", "-connect", "127.0.0.1:" + std::to_string(front_->port())}, how);
    EXPECT_TRUE(client);
    return client ? std::move(*client) : tools::ChildProcess();
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
  int halfPosts_ = 0;
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
  EXPECT_EQ(post(), "429");
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

TEST_F(FrontTest, OnePostThatNoReceiverAnswersCostsOthersNothing) {
  TestHTTPServer one, another;
  for (TestHTTPServer* receiver : {&one, &another})
    receiver->setHandler([](const TestHTTPServer::Request& request) {
      TestHTTPServer::Reply reply;
      if (request.body.size() == kOddSize) reply.behaviour = TestHTTPServer::Behaviour::close;
      return reply;
    });
  start({one.port(), another.port()});
  for (int i = 0; i < 3; ++i) {
    EXPECT_EQ(post(kOddSize), "429");
    EXPECT_EQ(one.requestCount() + another.requestCount(), 4U * static_cast<size_t>(i) + 2)
        << "each had it once";
    for (int j = 0; j < 2; ++j) EXPECT_EQ(post(), "200");
  }
}

TEST_F(FrontTest, Answers429WhereItsOwnDiskIsFull) {
  if (!mayMountOfItsOwn()) GTEST_SKIP() << "this user may mount nothing";
  const std::string said = inChildProcess([&]() -> std::string {
    const std::string disk = folder_ / "body";
    std::filesystem::create_directory(disk);
    if (!unshareMounts() || ::mount("tmpfs", disk.c_str(), "tmpfs", 0, "size=64k,mode=0777") != 0)
      return "no disk could be made";
    TestHTTPServer receiver;
    start({receiver.port()});
    if (!front_) return "it does not start";
    const std::string small = post(), large = post(1 << 20), after = post();
    front_.reset();
    if (small + large + after != "200429200") return small + " " + large + " " + after;
    return folder_.read("error.log").find("No space left on device") != std::string::npos ? "" : "not full";
  });
  EXPECT_EQ(said, "");
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

TEST_F(FrontTest, EndsABodyThatStandsStillAndShowsItToNoReceiver) {
  TestHTTPServer receiver;
  changeSite("client_body_timeout 15s;", "client_body_timeout 1s;");
  start({receiver.port()});
  EXPECT_TRUE(startHalfAPost().wait(kTestDeadline)) << "nginx ends the connection";
  EXPECT_TRUE(eventually([&] {
    return folder_.read("access.log").find("POST /v1/events 408 - - ") != std::string::npos;
  })) << folder_.read("access.log");
  EXPECT_EQ(post(), "200");
  EXPECT_EQ(receiver.requestCount(), 1U);
}

TEST_F(FrontTest, BoundsWhatOneAddressKeepsWhereItsLinesForThatCount) {
  TestHTTPServer receiver;
  changeSite("# limit_conn_zone ", "limit_conn_zone ");
  changeSite("# limit_conn kyt_addresses 100;", "limit_conn kyt_addresses 2;");
  start({receiver.port()});
  EXPECT_EQ(post(), "200");
  {
    const tools::ChildProcess one = startHalfAPost(), another = startHalfAPost();
    EXPECT_TRUE(eventually([&] { return post() == "429"; }));
  }
  EXPECT_TRUE(eventually([&] { return post() == "200"; })) << "both are gone";
}

TEST_F(FrontTest, ShowsReceiversNoSlowBody) {
  TestHTTPServer receiver;
  start({receiver.port()});
  EXPECT_TRUE(post(200000, {"--limit-rate", "1000", "--max-time", "3"}).ends_with("000")) << "curl gave up";
  EXPECT_EQ(post(), "200");
  EXPECT_EQ(receiver.requestCount(), 1U);
}

}  // namespace
}  // namespace kyt
