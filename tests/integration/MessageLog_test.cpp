// The local message log of a running daemon: what stands in it, and that it is under the daemon's root.
#include <filesystem>

#include "tests/integration/HierarchyFixture.h"

namespace kyt {
namespace {

class MessageLog : public HierarchyTest {
 protected:
  void start(bool consent) {
    tools::Stage::Options options;
    options.consent = consent;
    lay(std::move(options));
    putBag("cadmor", {entry("talks")});
    startDaemon();
  }
  std::string folder() const { return stage_->folder() + "/var/mobile/Library/Logs/Faultbin/Retired"; }
  std::vector<std::string> files() const {
    std::vector<std::string> names;
    for (const auto& item : std::filesystem::directory_iterator(folder()))
      names.push_back(item.path().filename().string());
    std::sort(names.begin(), names.end());
    return names;
  }
};

TEST_F(MessageLog, HasWhatWasPostedAndWhichFilesWereUploaded) {
  start(true);
  ASSERT_FALSE(tools::writeFile(folder() + "/crash_1.diag", "another's\n", 0644));
  ASSERT_FALSE(tools::writeFile(folder() + "/kytreportingd_5_messageLog.diag", "old\n", 0644));
  std::filesystem::last_write_time(folder() + "/kytreportingd_5_messageLog.diag",
                                   std::filesystem::file_time_type::clock::now() - std::chrono::hours(25));
  const Process client = open("talks", -1, 1);
  sendAndSettle(*client, 10, R"({"text":"two\nlines"})");
  flush(*client);
  const std::string reply =
      client->ask(R"({"do":"send","category":11,"type":1,"flag":1,"reply":true,"payload":{}})");
  EXPECT_TRUE(reply.starts_with("{\\n") && reply.ends_with("\\n}")) << reply;
  ASSERT_EQ(files().size(), 2U) << "the old one was deleted, the foreign one was not";
  EXPECT_EQ(files()[0], "crash_1.diag");
  EXPECT_EQ(contents(folder() + "/crash_1.diag"), "another's\n");
  const std::string name = files()[1];
  EXPECT_EQ(name.substr(0, 14), "kytreportingd_");
  EXPECT_TRUE(name.ends_with("_messageLog.diag")) << name;

  const std::string text = contents(folder() + "/" + name);
  EXPECT_EQ(text.find("+0000) [httppost -> flushMessages] {\n"), 21U) << text;
  EXPECT_NE(text.find("+0000) [httppost -> sendMessageWithDictionary] {\n"), std::string::npos) << text;
  EXPECT_NE(text.find("\"text\": \"two\\nlines\""), std::string::npos) << text;
  EXPECT_TRUE(logged("writeToLogFile: Created new kytreportingd log file " + folder() + "/" + name));
  EXPECT_TRUE(logged("writeToLogFile: Deleted expired kytreportingd log file " + folder() +
                     "/kytreportingd_5_messageLog.diag ("));
}

TEST_F(MessageLog, IsNotTouchedWhereNothingMayBeShown) {
  start(false);
  const Process client = open("talks", -1, 1, false, "live:");
  sendAndSettle(*client, 10);
  finish(*client);
  EXPECT_EQ(stage_->stopDaemon().value_or(-1), 0);
  EXPECT_TRUE(files().empty());
}

TEST_F(MessageLog, HasItsFolderMadeAgainWheneverItIsRemoved) {
  start(true);
  const Process client = open("talks", -1, 1);
  for (int round = 1; round <= 2; ++round) {
    std::filesystem::remove_all(folder());
    sendAndSettle(*client, 10);
    flush(*client);
    ASSERT_TRUE(std::filesystem::is_directory(folder())) << daemonLog();
    EXPECT_EQ(std::filesystem::status(folder()).permissions() & std::filesystem::perms::others_all,
              std::filesystem::perms::none);
    ASSERT_EQ(files().size(), 1U) << daemonLog();
    EXPECT_NE(contents(folder() + "/" + files()[0]).find(" -> flushMessages] "), std::string::npos);
  }
  EXPECT_TRUE(logged("writeToLogFile: Creating kytreportingd log directory at " + folder()));
  finish(*client);
  EXPECT_EQ(stage_->stopDaemon().value_or(-1), 0);
  EXPECT_FALSE(logged("message-log-line-lost")) << daemonLog();
}

TEST_F(MessageLog, TellsOfEachLineThatItLosesToWhatStandsInItsPlace) {
  tools::Stage::Options options;
  options.consent = true;
  lay(std::move(options));
  std::filesystem::create_directories(std::filesystem::path(folder()).parent_path());
  ASSERT_FALSE(tools::writeFile(folder(), "no folder", 0644));
  putBag("cadmor", {entry("talks")});
  startDaemon();
  const Process client = open("talks", -1, 1);
  for (int i = 0; i < 2; ++i) {
    sendAndSettle(*client, 10);
    flush(*client);
  }
  EXPECT_TRUE(arrive("client=talks&method=10", 2)) << daemonLog();
  finish(*client);
  EXPECT_EQ(stage_->stopDaemon().value_or(-1), 0);
  const size_t told =
      countLogged("<3>writeToLogFile: Failed to create new kytreportingd log file " + folder());
  EXPECT_GE(told, 2U) << daemonLog();
  EXPECT_TRUE(logged("shutDown: message-log-line-lost: " + std::to_string(told) + "\n")) << daemonLog();
  EXPECT_EQ(contents(folder()), "no folder");
}

}  // namespace
}  // namespace kyt
