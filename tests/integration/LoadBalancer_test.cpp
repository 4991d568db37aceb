// Posts through a real nginx whose upstream is away, configured with the lines that the fleet's guide shows: its own
// failures must not switch back ends off, the upstream's must.
#include <gtest/gtest.h>
#include <sys/mount.h>

#include <filesystem>
#include <fstream>
#include <optional>
#include <sstream>
#include <string>

#include "tests/integration/DaemonProcess.h"
#include "tests/integration/Nginx.h"
#include "tests/integration/TestClient.h"
#include "tests/receiver/ReceiverProcess.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/TestHTTPServer.h"

namespace kyt {
namespace {

constexpr int kTorvel = 5;

// The lines of docs/FLEET.md for nginx, with one address instead of the named group of servers.
std::string documentedLines(const std::string& upstream) {
  std::ifstream file(std::string(KYT_DOCUMENTS) + "/FLEET.md");
  std::ostringstream text;
  text << file.rdbuf();
  const std::string document = text.str(), fence = "\n```nginx\n";
  const size_t start = document.find(fence);
  if (start == std::string::npos) return {};
  const size_t begin = start + fence.size();
  std::string lines = document.substr(begin, document.find("\n```", begin) + 1 - begin);
  const std::string named = "http://receivers";
  const size_t at = lines.find(named);
  return at == std::string::npos ? std::string() : lines.replace(at, named.size(), upstream);
}

class LoadBalancer : public ::testing::Test {
 protected:
  void SetUp() override {
    if (!Nginx::isHere()) GTEST_SKIP() << "nginx is not installed";
  }
  void TearDown() override {
    if (!nginx_) return;
    daemon_.terminate();
    EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
  }
  // nginx passes /v1/events on to `upstream`, with these lines; events of flag 1 go straight to the sink.
  void start(const std::string& locations) {
    nginx_.emplace(authority_.issue(), locations);
    const Dictionary entry{{"post_url", nginx_->base() + "/v1/events"},
                           {"realtime_post_url", sink_.url("/direct")}};
    const Dictionary section{{"httppost", Dictionary{{"clients", Array{entry}}}}};
    nginx_->put("torvel",
                signedBag(Dictionary{{"version", "1"}, {"vantu_internal", section}}, propertyLists_), 0);
    daemon_.root().write("etc/kytreportingd/device.toml", "ReleaseType = \"Internal\"\ncountry = \"DE\"\n");
    daemon_.writeSettings("[storebag]\ninternal_host = \"" + nginx_->base() + "\"\npublic_host = \"" +
                          nginx_->base() + "\"\n[tls]\nca_file = \"" + authority_.file() +
                          "\"\n[log]\ntarget = \"stderr\"\n");
    ASSERT_TRUE(daemon_.startAndWait()) << daemon_.log();
  }
  // A batch to nginx and, once that is answered, an event straight to the sink.
  void postTwice() {
    TestClient client(daemon_.socketPath(), kTorvel);
    EXPECT_EQ(client.configure(), "live: httppost") << daemon_.log();
    EXPECT_TRUE(client.send(9, 1, Dictionary{{"k", 1}}));
    EXPECT_NE(client.flush(), "no answer");
    EXPECT_TRUE(client.send(9, 2, Dictionary{{"k", 2}}, 1));
    EXPECT_TRUE(client.finish());
  }
  bool secondArrived() {
    return eventually([&] { return sink_.requestCount() > 0; });
  }
  bool wasSwitchedOff(const std::string& status) {
    return daemon_.log().find("backend httppost disabled by server " + status) != std::string::npos;
  }
  // nginx writes its line after the daemon has the answer.
  std::string lastAnswer() {
    std::string status = "none";
    static_cast<void>(eventually([&] {
      for (const std::string& line : nginx_->accesses())
        if (line.starts_with("POST /v1/events ")) status = line.substr(16, 3);
      return status != "none";
    }));
    return status;
  }

  PugixmlPropertyLists propertyLists_;
  TestCertificateAuthority authority_;
  TestHTTPServer sink_;
  std::optional<Nginx> nginx_;
  DaemonProcess daemon_{"https://127.0.0.1:9"};  // replaced by start()
};

// Nobody listens on the discard port of the loopback here.
constexpr char kDeadUpstream[] = "http://127.0.0.1:9";

TEST_F(LoadBalancer, WithTheDocumentedLinesADeadUpstreamCostsOnePostAndNoBackEnd) {
  const std::string lines = documentedLines(kDeadUpstream);
  ASSERT_NE(lines, "") << "docs/FLEET.md has no block of nginx";
  start(lines);
  postTwice();
  EXPECT_EQ(lastAnswer(), "429");
  EXPECT_TRUE(secondArrived()) << daemon_.log();
}

TEST_F(LoadBalancer, AReceiverWithoutLogAndRoomCostsOnePostAndNoBackEnd) {
  receiver::ReceiverProcess::Options options;
  options.servers = "[\"nats://127.0.0.1:9\"]";  // nobody
  options.spoolMaxBytes = 1 << 20;
  receiver::ReceiverProcess receiver(options);
  ASSERT_TRUE(receiver.isReady()) << receiver.output();
  uint64_t number = 0;
  for (const size_t size : {100'000, 1'000, 0})
    ASSERT_TRUE(eventually([&] { return receiver.post(receiver::postText(++number, size)).status == 429; }));
  const double before = receiver.metric("kyt_refused_total{reason=\"spool-full\"}").value_or(0);
  start(documentedLines("http://127.0.0.1:" + std::to_string(receiver.port())));
  postTwice();
  EXPECT_EQ(lastAnswer(), "429");
  EXPECT_TRUE(secondArrived()) << daemon_.log();
  EXPECT_GT(receiver.metric("kyt_refused_total{reason=\"spool-full\"}"), before);
}

TEST_F(LoadBalancer, WithoutThemADeadUpstreamSwitchesTheBackEndOff) {
  start(std::string("location /v1/events { proxy_pass ") + kDeadUpstream + "; }\n");
  postTwice();
  EXPECT_EQ(lastAnswer(), "502");
  EXPECT_TRUE(wasSwitchedOff("502")) << daemon_.log();
}

TEST_F(LoadBalancer, TheUpstreamsOwn503StillSwitchesTheBackEndOff) {
  TestHTTPServer upstream;
  TestHTTPServer::Reply refusal;
  refusal.status = 503;
  upstream.setReply(refusal);
  start(documentedLines(upstream.url("")));
  postTwice();
  EXPECT_EQ(lastAnswer(), "503");
  EXPECT_TRUE(wasSwitchedOff("503")) << daemon_.log();
}

// Without servers of the test's own beside the child, which has some.
TEST(LoadBalancerWithAFullDisk, AnswersWith429UnderTheDocumentedLines) {
  if (!Nginx::isHere()) GTEST_SKIP() << "nginx is not installed";
  if (!mayMountOfItsOwn()) GTEST_SKIP() << "this user may mount nothing";
  TestCertificateAuthority authority;
  const TemporaryFolder disk;
  const std::string body = disk.write("body", std::string(1 << 20, 'x'));
  const std::string said = inChildProcess([&]() -> std::string {
    const std::string folder = disk / "small";
    std::filesystem::create_directory(folder);
    if (!unshareMounts() || ::mount("tmpfs", folder.c_str(), "tmpfs", 0, "size=64k,mode=0777") != 0)
      return "no disk could be made";
    TestHTTPServer upstream;
    const Nginx nginx(authority.issue(),
                      documentedLines(upstream.url("")) + "client_body_temp_path " + folder + ";\n");
    std::string status;
    static_cast<void>(eventually([&] {
      status =
          runProgram("curl", {"-sS", "--cacert", authority.file(), "-o", "/dev/null", "-w", "%{http_code}",
                              "-H", "Expect:", "--data-binary", "@" + body, nginx.base() + "/v1/events"})
              .text;
      return !status.ends_with("000");
    }));
    if (nginx.errors().find("No space left on device") == std::string::npos) return "the disk was not full";
    return status;
  });
  EXPECT_EQ(said, "429");
}

}  // namespace
}  // namespace kyt
