// The spool in the hands of people: its file damaged, its posts listed.
#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <regex>
#include <string>
#include <vector>

#include "tests/receiver/ReceiverTest.h"
#include "tests/support/Programs.h"

namespace kyt::receiver {
namespace {

class ReceiverWithADamagedSpool : public ReceiverTest {
 protected:
  // So many posts are on the disk alone, and its pages are damaged behind the beginning.
  void spoolAndDamage(uint64_t first, uint64_t posts) {
    for (uint64_t i = first; i < first + posts; ++i) ASSERT_EQ(receiver_->post(postText(i)).status, 200);
    ASSERT_EQ(receiver_->metric("kyt_spool_posts"), posts);
    ASSERT_EQ(receiver_->terminate(), 0);
    std::fstream file(spool_ / "outbox.sqlite", std::ios::in | std::ios::out | std::ios::binary);
    file.seekp(60);  // the version of its tables
    file << "\x7f\x7f\x7f\x7f";
  }
  // As the manual page says it.
  void recover(const TemporaryFolder& into) const {
    const std::string command =
        "{ echo 'PRAGMA page_size=512; PRAGMA user_version=2; PRAGMA application_id=1264145410;'; sqlite3 '" +
        spool_.path() + "/outbox.sqlite.damaged' .dump | sed 's/^ROLLBACK;.*/COMMIT;/'; } | sqlite3 '" +
        into.path() + "/outbox.sqlite'";
    auto shell = tools::ChildProcess::start("/bin/sh", {"-c", command}, {});
    ASSERT_TRUE(shell);
    ASSERT_EQ(shell->wait(kTestDeadline), 0);
  }

  const TemporaryFolder spool_;
};

TEST_F(ReceiverWithADamagedSpool, SaysSoAndOverwritesNothingAndItsPostsCanBeHadAgain) {
  ReceiverProcess::Options options;
  options.spool = spool_.path();
  start(options);
  servers_.kill(0);
  spoolAndDamage(1, 5);
  receiver_->start();
  ASSERT_TRUE(receiver_->isReady()) << receiver_->output();
  EXPECT_EQ(receiver_->metric("kyt_spool_damaged_files"), 1);
  EXPECT_NE(receiver_->output().find("outbox.sqlite.damaged now; what was in it devices think delivered"),
            std::string::npos)
      << receiver_->output();
  spoolAndDamage(6, 1);
  receiver_->start();
  EXPECT_EQ(receiver_->metric("kyt_spool_damaged_files"), 2);

  if (::access("/usr/bin/sqlite3", X_OK) != 0) GTEST_SKIP() << "sqlite3 is not installed";
  const TemporaryFolder again;
  recover(again);
  servers_.start(0);
  ReceiverProcess::Options other;
  other.servers = servers_.urlsAsToml();
  other.spool = again.path();
  ReceiverProcess second(other);
  ASSERT_TRUE(second.becomesReady()) << second.output();
  EXPECT_TRUE(eventually([&] { return second.metric("kyt_spool_posts") == 0; })) << second.output();
  EXPECT_EQ(second.metric("kyt_spool_replayed_total"), 5);
  view_.emplace(servers_.url(0));
  EXPECT_EQ(view_->messages(), 5U);
}

class SpoolForPeople : public ReceiverTest {
 protected:
  [[nodiscard]] ProgramRun run(std::vector<std::string> arguments) const {
    arguments.insert(arguments.begin(), {"--config", receiver_->configFile()});
    return runProgram(KYT_RECEIVER, arguments);
  }
};

TEST_F(SpoolForPeople, IsListedAndAPostRemovedWhileNoReceiverHasIt) {
  start();
  servers_.kill(0);
  for (uint64_t i = 1; i <= 2; ++i)
    ASSERT_EQ(receiver_->post(postText(i), {"X-KYT-Sender: QPW", "X-KYT-Client-Name: c\xc3\xa4"}).status,
              200);
  EXPECT_EQ(run({"--list-spool"}).status, 1) << "the receiver has it";
  EXPECT_EQ(run({"--remove-from-spool", "1"}).status, 1);
  ASSERT_EQ(receiver_->terminate(), 0);
  const ProgramRun both = run({"--list-spool"});
  EXPECT_EQ(both.status, 0);
  EXPECT_TRUE(std::regex_match(
      both.text, std::regex("1 [0-9a-f]{64} 20[0-9-]{8}T[0-9:]{8}Z [0-9]+ bytes QPW/c\xc3\xa4\n"
                            "2 [0-9a-f]{64} 20[0-9-]{8}T[0-9:]{8}Z [0-9]+ bytes QPW/c\xc3\xa4\n")))
      << both.text;
  const ProgramRun full = runProgram(
      "/bin/sh", {"-c", KYT_RECEIVER " --config \"$0\" --list-spool >/dev/full", receiver_->configFile()});
  EXPECT_EQ(full.status, 1) << "a part would be taken for the whole";
  EXPECT_EQ(run({"--remove-from-spool", "3"}).status, 1);
  EXPECT_EQ(run({"--remove-from-spool", "1"}).status, 0);
  EXPECT_TRUE(run({"--list-spool"}).text.starts_with("2 "));
  receiver_->start();
  EXPECT_EQ(receiver_->metric("kyt_spool_posts"), 1);
}

}  // namespace
}  // namespace kyt::receiver
