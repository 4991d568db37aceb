// The commands that the documents show deliver events as they are written.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <regex>

#include "tests/integration/StageFixture.h"
#include "tests/support/Eventually.h"
#include "tests/tools/ManualText.h"
#include "tools/demo/Http.h"

namespace kyt {
namespace {

// The commands with what a reader fills in.
std::string filledIn(const std::string& text, const std::string& placeholder, const std::string& value) {
  return std::regex_replace(text, std::regex(placeholder), value);
}

ProgramRun shell(const std::string& folder, const std::string& commands) {
  return runProgram("sh", {"-c", "set -e\nPATH=" KYT_PROGRAMS ":$PATH\ncd '" + folder + "'\n" + commands});
}

// Beside the demonstration, as `./kyt run` starts it.
class TryingIt : public ::testing::Test {
 protected:
  void SetUp() override {
    ::chmod(folder_.path().c_str(), 0755);  // started by root, the daemon runs as another user
    tools::ChildProcess::Options how;
    how.outputFile = folder_ / "output";
    demonstration_ = tools::ChildProcess::start(
        KYT_PROGRAMS "/kytdemo",
        {"--programs", KYT_PROGRAMS, "--share", KYT_SHARE, "--folder", folder_ / "stage"}, how);
    ASSERT_TRUE(demonstration_);
    ASSERT_TRUE(eventually([this] { return said("See them come in at ") || !demonstration_->isRunning(); }));
    ASSERT_TRUE(demonstration_->isRunning()) << folder_.read("output");
  }
  void TearDown() override {
    demonstration_->signal(SIGTERM);
    EXPECT_EQ(demonstration_->wait(std::chrono::seconds(60)).value_or(-1), 0) << folder_.read("output");
  }
  [[nodiscard]] bool said(const std::string& text) const {
    return folder_.read("output").find(text) != std::string::npos;
  }
  // The first group of what it printed.
  [[nodiscard]] std::string printed(const char* expression) const {
    const Names found = matchesIn(folder_.read("output"), expression);
    return found.empty() ? "nothing" : *found.begin();
  }
  [[nodiscard]] bool arrive(const std::string& filter, int count) const {
    const auto answer = tools::httpGet(printed("page (http://[0-9.:]+)/") + "/api/wait?timeout=30&events=" +
                                           std::to_string(count) + "&" + filter,
                                       60);
    return answer && answer->body.find("\"reached\":true") != std::string::npos;
  }

  TemporaryFolder folder_;
  std::optional<tools::ChildProcess> demonstration_;
};

TEST_F(TryingIt, TheCommandsDeliver) {
  folder_.write("script.jsonl", blockOf("PROGRAMS.md", "jsonl example=script"));
  const ProgramRun run = shell(folder_.path(), filledIn(blockOf("PROGRAMS.md", "sh example=trying"),
                                                        "SOCKET(?= )", printed("socket ([^,]+), log")));
  EXPECT_EQ(run.status, 0) << run.text;
  EXPECT_TRUE(run.text.starts_with("finished\nlive: ")) << run.text;
  EXPECT_TRUE(arrive("client=example&service=demo&method=1&status=2", 1)) << run.text;
  EXPECT_TRUE(arrive("client=example&service=demo&method=10&status=1", 1)) << run.text;
}

class IPCFromAShell : public StageTest {
 protected:
  void SetUp() override {
    lay();
    putBag("cadmor", {entry("example")});
    startDaemon();
  }
  [[nodiscard]] ProgramRun run(const char* label) const {
    return shell(stage_->folder(),
                 filledIn(blockOf("WIRE-IPC.md", label), "SOCKET=[^\n]+", "SOCKET=" + socket()));
  }
};

TEST_F(IPCFromAShell, TheCommandsDeliver) {
  for (const char* tool : {"gdbus", "busctl"})
    if (!isInstalled(tool)) GTEST_SKIP() << tool << " is not installed";
  const ProgramRun sent = run("sh example=deliver");
  EXPECT_EQ(sent.status, 0) << sent.text;
  EXPECT_EQ(sent.text, "('finished',)\ns \"finished\"\n");
  EXPECT_TRUE(arrive("client=example&service=demo&method=3&status=4", 2)) << daemonLog();
}

TEST_F(IPCFromAShell, TheCommandsLookAround) {
  for (const char* tool : {"busctl", "dbus-send"})
    if (!isInstalled(tool)) GTEST_SKIP() << tool << " is not installed";
  const ProgramRun looked = run("sh example=look");
  EXPECT_EQ(looked.status, 0) << looked.text;
  EXPECT_NE(looked.text.find(".SendMessageWithSessionInfo "), std::string::npos) << looked.text;
  EXPECT_NE(looked.text.find("string \"URL not available\""), std::string::npos) << looked.text;
}

}  // namespace
}  // namespace kyt
