// What leaves the log, and what happens where nothing does.
#include <gtest/gtest.h>

#include <optional>
#include <string>
#include <utility>

#include "tests/receiver/ReceiverTest.h"

namespace kyt::receiver {
namespace {

class RetentionOfTheLog : public ReceiverTest {
 protected:
  // Exit status and output of a run with the settings of that receiver.
  [[nodiscard]] std::pair<int, std::string> run(const ReceiverProcess& receiver, const char* option) const {
    const TemporaryFolder folder;
    tools::ChildProcess::Options how;
    how.outputFile = folder / "output";
    auto ran = tools::ChildProcess::start(KYT_RECEIVER, {"--config", receiver.configFile(), option}, how);
    const int status = ran ? ran->wait(kTestDeadline).value_or(-1) : -1;
    return {status, folder.read("output")};
  }
};

TEST_F(RetentionOfTheLog, LetsWhatIsOlderLeaveSoThatPostsGoOn) {
  ReceiverProcess::Options options;
  options.log = "max_age_seconds = 4\nmax_bytes = 1048576\n";
  start(options);
  uint64_t posts = 0;
  ASSERT_TRUE(eventually([&] {
    EXPECT_EQ(receiver_->post(postText(posts++, 100000)).status, 200);
    return receiver_->metric("kyt_spool_posts").value_or(0) > 0;
  }));
  EXPECT_GE(receiver_->metric("kyt_log_refusals_total{kind=\"full\"}"), 1);
  EXPECT_NE(receiver_->output().find("log: it has no room: maximum bytes exceeded (10077)"),
            std::string::npos)
      << receiver_->output();
  EXPECT_TRUE(spoolBecomesEmpty()) << receiver_->output();
  EXPECT_FALSE(view_->message(1));
  EXPECT_EQ(receiver_->post(postText(posts++)).status, 200);
  EXPECT_EQ(receiver_->metric("kyt_spool_replayed_total"),
            receiver_->metric("kyt_posts_total{result=\"spooled\"}"));
}

TEST_F(RetentionOfTheLog, OfAStreamThatIsThereIsToldAndChangedOnRequestAlone) {
  ReceiverProcess::Options before;
  before.log = "max_age_seconds = 0\n";  // as earlier versions made it
  start(before);
  EXPECT_EQ(receiver_->post(postText(1)).status, 200);
  EXPECT_EQ(receiver_->output().find("keeps posts for"), std::string::npos) << receiver_->output();
  ReceiverProcess::Options options;
  options.servers = servers_.urlsAsToml();
  ReceiverProcess now(options);
  ASSERT_TRUE(now.becomesReady());
  EXPECT_TRUE(eventually([&] {
    return now.output().find("the stream \"kyt-events\" keeps posts for 0 seconds") != std::string::npos;
  })) << now.output();

  const auto [status, text] = run(now, "--make-streams");
  EXPECT_EQ(status, 1);
  EXPECT_NE(text.find("The stream \"kyt-events\" keeps posts for ever; by the settings for 604800 seconds."),
            std::string::npos)
      << text;
  EXPECT_NE(text.find("The stream \"kyt-dead-letters\" keeps posts for ever"), std::string::npos) << text;
  EXPECT_NE(run(now, "--make-streams").first, 0) << "it changed something";
  EXPECT_EQ(run(now, "--update-streams").first, 0);
  EXPECT_EQ(run(now, "--make-streams").first, 0);
  EXPECT_EQ(view_->messages(), 1U) << "what is not too old stays";
  EXPECT_EQ(run(*receiver_, "--make-streams").first, 1);
}

TEST_F(RetentionOfTheLog, TellsOfEachThingThatDiffers) {
  ReceiverProcess::Options options;
  options.log = "max_age_seconds = 60\nmax_bytes = 2097152\n";
  start(options);
  ASSERT_TRUE(view_->setMaxBytes(-1));
  const auto [status, text] = run(*receiver_, "--make-streams");
  EXPECT_EQ(status, 1);
  EXPECT_NE(
      text.find("The stream \"kyt-events\" takes any number of bytes; by the settings 2097152 bytes.\n"),
      std::string::npos)
      << text;
  EXPECT_EQ(text.find("kyt-dead-letters"), std::string::npos) << text;
}

}  // namespace
}  // namespace kyt::receiver
