// The receiver that speaks TLS itself, with a stock client.
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "tests/receiver/ReceiverTest.h"
#include "tests/support/Programs.h"
#include "tests/support/TestCertificates.h"

namespace kyt::receiver {
namespace {

class ReceiverWithTLS : public ReceiverTest {
 protected:
  void SetUp() override {
    ReceiverTest::SetUp();
    if (IsSkipped()) return;
    if (!isInstalled("curl")) GTEST_SKIP() << "curl is not installed";
    identity_ = authority_.issue();
  }
  ReceiverProcess::Options withIdentity(const std::string& certificate, const std::string& key) {
    ReceiverProcess::Options options;
    options.servers = servers_.urlsAsToml();
    options.more = "certificate = \"" + folder_.write("certificate.pem", certificate) + "\"\nkey = \"" +
                   folder_.write("key.pem", key) + "\"\n";
    return options;
  }
  void startWithTLS(const std::string& limits = {}) {
    auto options = withIdentity(identity_.certificatePEM, identity_.keyPEM);
    options.limits = limits;
    start(options);
  }
  // What curl says: the status of the answer, and its own.
  [[nodiscard]] ProgramRun curl(const std::string& body, std::vector<std::string> more = {}) const {
    std::vector<std::string> arguments = {"--silent",
                                          "--cacert",
                                          authority_.file(),
                                          "--write-out",
                                          "%{http_code}",
                                          "--data-binary",
                                          "@" + folder_.write("body", body),
                                          "--max-time",
                                          "30"};
    arguments.insert(arguments.end(), more.begin(), more.end());
    arguments.push_back("https://127.0.0.1:" + std::to_string(receiver_->port()) + "/v1/events");
    return runProgram("curl", arguments);
  }

  TestCertificateAuthority authority_;
  TestCertificate identity_;
  TemporaryFolder folder_;
};

TEST_F(ReceiverWithTLS, TakesPostsUnderItsCertificate) {
  startWithTLS();
  const std::string large = postText(1, 300000);
  EXPECT_EQ(curl(large).text, "200");
  EXPECT_EQ(curl(postText(2), {"--tlsv1.2", "--tls-max", "1.2"}).text, "200");
  EXPECT_EQ(view_->messages(), 2U);
  EXPECT_EQ(view_->message(1)->body, large);
}

TEST_F(ReceiverWithTLS, RefusesOldVersionsAndWhoeverSpeaksNoTLS) {
  startWithTLS();
  constexpr int kHandshakeFailed = 35;
  EXPECT_EQ(curl(postText(1), {"--tlsv1.0", "--tls-max", "1.1", "--ciphers", "DEFAULT@SECLEVEL=0"}).status,
            kHandshakeFailed);
  HttpConnection plain(receiver_->port());
  EXPECT_NE(plain.post("/v1/events", postText(2)).status, 200);
  EXPECT_TRUE(plain.isClosed());
  EXPECT_EQ(curl(postText(3)).text, "200");
  EXPECT_EQ(view_->messages(), 1U);
}

TEST_F(ReceiverWithTLS, EndsHandshakesThatDoNotGoOnAndServesOthersMeanwhile) {
  startWithTLS("idle_seconds = 2\n");
  std::vector<HttpConnection> silent;
  for (int i = 0; i < 20; ++i) {
    silent.emplace_back(receiver_->port());
    silent.back().send(std::string("\x16\x03\x01\x02\x00\x01", 6));  // the beginning of a first message
  }
  for (uint64_t i = 1; i <= 5; ++i) EXPECT_EQ(curl(postText(i)).text, "200");
  for (HttpConnection& connection : silent) EXPECT_TRUE(connection.isClosed());
  EXPECT_EQ(view_->messages(), 5U);
}

TEST_F(ReceiverWithTLS, DoesNotStartWithAKeyThatIsNotItsCertificates) {
  receiver_.emplace(withIdentity(identity_.certificatePEM, authority_.issue().keyPEM));
  EXPECT_FALSE(receiver_->isReady());
  EXPECT_NE(receiver_->output().find("can't start the server"), std::string::npos) << receiver_->output();
  EXPECT_NE(receiver_->output().find("are certificate and key PEM"), std::string::npos)
      << receiver_->output();
  receiver_->kill();
}

}  // namespace
}  // namespace kyt::receiver
