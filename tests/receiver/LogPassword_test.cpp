// A log that asks for a password, which stands in the address of its server.
#include <gtest/gtest.h>

#include <string>

#include "tests/receiver/NatsServer.h"
#include "tests/receiver/ReceiverProcess.h"
#include "tests/support/Eventually.h"
#include "tests/support/Programs.h"

namespace kyt::receiver {
namespace {

class LogWithAPassword : public ::testing::Test {
 protected:
  void SetUp() override {
    if (!NatsServers::isInstalled()) GTEST_SKIP() << "nats-server is not installed";
    servers_.start();
  }
  [[nodiscard]] std::string urlWith(const std::string& password) const {
    std::string url = servers_.url(0);
    return url.insert(url.find("://") + 3, "kyt:" + password + "@");
  }
  [[nodiscard]] ReceiverProcess::Options optionsWith(const std::string& password) const {
    ReceiverProcess::Options options;
    options.servers = "[\"" + urlWith(password) + "\"]";
    return options;
  }

  NatsServers servers_{NatsServers::Options{1, "authorization { user: kyt, password: hidden }\n"}};
};

TEST_F(LogWithAPassword, TakesPostsOfAReceiverThatHasItAndWhoseLinesDoNotShowIt) {
  ReceiverProcess receiver(optionsWith("hidden"));
  ASSERT_TRUE(receiver.isReady()) << receiver.output();
  std::string said;
  EXPECT_TRUE(eventually([&] {
    const ProgramRun made = runProgram(KYT_RECEIVER, {"--config", receiver.configFile(), "--make-streams"});
    said += made.text;
    return made.status == 0;
  })) << said;
  ASSERT_TRUE(receiver.becomesReady()) << receiver.output();
  EXPECT_EQ(receiver.post(postText(1)).status, 200);
  EXPECT_EQ(StreamView(urlWith("hidden")).messages(), 1U);
  EXPECT_EQ(receiver.terminate(), 0);
  said += receiver.output();
  EXPECT_NE(said.find("connected to"), std::string::npos) << said;
  EXPECT_EQ(said.find("hidden"), std::string::npos) << said;
}

TEST_F(LogWithAPassword, TakesNothingOfAReceiverThatHasAnother) {
  ReceiverProcess receiver(optionsWith("wrong"));
  ASSERT_TRUE(receiver.isReady()) << receiver.output();
  EXPECT_TRUE(eventually([&] { return receiver.output().find("Authentication") != std::string::npos; }))
      << receiver.output();
  EXPECT_EQ(receiver.get("/readyz").status, 503);
  EXPECT_EQ(receiver.post(postText(1)).status, 200) << "the spool has it";
  EXPECT_EQ(receiver.metric("kyt_spool_posts"), 1);
}

TEST_F(LogWithAPassword, NamesAFileOfItsSettingsThatItCannotRead) {
  ReceiverProcess::Options options = optionsWith("hidden");
  options.log = "credentials = \"/nowhere/receiver.creds\"\n";
  ReceiverProcess receiver(options);
  ASSERT_TRUE(receiver.isReady()) << receiver.output();
  EXPECT_TRUE(eventually([&] {
    return receiver.output().find("/nowhere/receiver.creds: No such file or directory") != std::string::npos;
  })) << receiver.output();
}

}  // namespace
}  // namespace kyt::receiver
