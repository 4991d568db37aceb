// The commands that the documents show deliver events as they are written.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <regex>

#include "tests/integration/StageFixture.h"
#include "tests/support/Eventually.h"
#include "tests/support/Sanitizers.h"
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

TEST(EventsWithNames, TheCommandsTellWhetherTheStorebagFits) {
  const TemporaryFolder folder;
  folder.write("events.toml", blockOf("PROGRAMS.md", "toml example=events"));
  const std::string bag = exampleOf("kytreportingd-storebag.5", "storebag"), hashed = "\"sha256\"";
  folder.write("bag.toml", bag);
  const std::string commands = blockOf("PROGRAMS.md", "sh example=events");
  const ProgramRun fits = shell(folder.path(), commands);
  EXPECT_EQ(fits.status, 0) << fits.text;
  const ProgramRun generated = shell(folder.path(), blockOf("PROGRAMS.md", "sh example=generate"));
  EXPECT_EQ(generated.status, 0) << generated.text;
  for (const auto& [name, what] :
       {std::pair("events.h", "kyt_send_event_page_opened("),
        std::pair("events.hpp", "namespace kyt::events {\n"), std::pair("events.py", "class PageOpened:\n")})
    EXPECT_NE(folder.read(name).find(what), std::string::npos) << name;
  ASSERT_NE(bag.find(hashed), std::string::npos);
  folder.write("bag.toml", std::string(bag).replace(bag.find(hashed), hashed.size(), "\"keep\""));
  const ProgramRun gap = shell(folder.path(), commands);
  EXPECT_EQ(gap.status, 1);
  EXPECT_NE(gap.text.find("personal-unfiltered: \"account\""), std::string::npos) << gap.text;
}

TEST(TestingAProgram, TheCommandsShowWhatItTold) {
  const TemporaryFolder folder;
  folder.write("script.jsonl", blockOf("PROGRAMS.md", "jsonl example=script"));
  const ProgramRun run = shell(folder.path(), blockOf("PROGRAMS.md", "sh example=listen"));
  EXPECT_EQ(run.status, 0) << run.text;
  EXPECT_NE(run.text.find(
                R"({"event":"message","connection":1,"category":10,"type":1,"flag":0,"payload":{"step":1}})"),
            std::string::npos)
      << run.text;
}

TEST(TestingAProgram, MisspeltBackEndsAreRefusedWithThoseThatThereAre) {
  const TemporaryFolder folder;
  const Names names =
      matchesIn(textOf("platform/objects/Keys.h"), "kKYTReportingBackend\\w+\\[\\] = \"(\\w+)\"");
  ASSERT_GE(names.size(), 7U);
  const auto listen = [&folder](const std::string& live) {
    return runProgram("timeout", {"--preserve-status", "30", KYT_PROGRAMS "/kytctl", "listen", "--socket",
                                  folder / "s", "--live", live});
  };
  for (const char* live : {"htttppost", "httppost,htttppost", "httppost, qrs", "HTTPPost"}) {
    const ProgramRun run = listen(live);
    EXPECT_EQ(run.status, 2) << live << run.text;
    EXPECT_TRUE(run.text.starts_with("kytctl: --live: there is no back end \"")) << run.text;
    const size_t list = run.text.find("; there are ");
    ASSERT_NE(list, std::string::npos) << run.text;
    EXPECT_EQ(matchesIn(run.text.substr(list + 12), "(\\w+)[,\n]"), names);
  }
  // The manual names them too.
  const std::string section = sectionOf("kytctl.1", "kytctl listen");
  for (const std::string& name : names)
    EXPECT_TRUE(std::regex_search(section, std::regex("[ \n]" + name + "[ \n]"))) << name;
}

TEST(TestingAProgram, EachBackEndMayBeLive) {
  const TemporaryFolder folder;
  std::string all;
  for (const std::string& name :
       matchesIn(textOf("platform/objects/Keys.h"), "kKYTReportingBackend\\w+\\[\\] = \"(\\w+)\""))
    all += (all.empty() ? "" : ",") + name;
  for (const std::string& live : {all, std::string()}) {
    const ProgramRun run =
        shell(folder.path(), "kytctl listen --socket \"$PWD/s\" --live '" + live + R"(' > told & daemon=$!
until [ -S s ]; do kill -0 $daemon; sleep 0.01; done
printf '{"do":"open","sessionInfo":{"ClientType":20}}\n{"do":"configure"}\n{"do":"finish"}\n' |
  kytctl session --socket "$PWD/s" -
kill $daemon; wait $daemon
)");
    std::string told = live;
    std::replace(told.begin(), told.end(), ',', ' ');
    EXPECT_EQ(run.status, 0) << run.text;
    EXPECT_TRUE(run.text.starts_with(live.empty() ? "live:" : "live: " + told + "\n")) << run.text;
  }
}

TEST(DemonstrationAroundAProgram, TellsWhatArrivedAndWhatWasDroppedAndWhy) {
  const TemporaryFolder folder;
  folder.write("lines", R"({"category":10,"type":1,"payload":{"a":1}})"
                        "\n"
                        R"({"category":11,"type":2,"flag":1})"
                        "\n");
  const auto staged = [&folder](const std::string& program) {
    return shell(folder.path(), "kytdemo --share " KYT_SHARE " --stage -- " + program);
  };
  const ProgramRun sent = staged("sh -c 'kytctl send --client-type 8 --stdin < lines; exit 7'");
  EXPECT_EQ(sent.status, 7) << sent.text;
  EXPECT_NE(sent.text.find("live: httppost\nsent 2, lost 0, dropped 0\n"), std::string::npos) << sent.text;
  EXPECT_NE(sent.text.find("1 × client , sender QJ, method 10, status 1\n"), std::string::npos) << sent.text;
  EXPECT_NE(sent.text.find("1 × client , sender QJ, method 11, status 2\n"), std::string::npos) << sent.text;
  EXPECT_TRUE(std::regex_search(sent.text, std::regex("httppost +2 +0 +2 +0\n"))) << sent.text;
  const ProgramRun dropped = staged("kytctl send --client-type 2 --category 10 --type 1");
  EXPECT_EQ(dropped.status, 1) << dropped.text;
  EXPECT_NE(dropped.text.find("storebag not available\n"), std::string::npos) << dropped.text;
  EXPECT_NE(dropped.text.find("no-storebag"), std::string::npos) << dropped.text;
  EXPECT_EQ(staged("").status, 2);
}

TEST(SendFromStandardInput, EndsAtALineThatIsWrongAfterWhatStoodBefore) {
  const TemporaryFolder folder;
  const ProgramRun run = shell(folder.path(), R"(kytctl listen --socket "$PWD/s" > told & daemon=$!
until [ -S s ]; do sleep 0.01; done
printf '{"category":1,"type":2}\n\n{"category":"x","type":2}\n' |
  kytctl send --socket "$PWD/s" --client-type 20 --stdin || echo "status $?"
kill $daemon; wait $daemon; grep -c '"event":"message"' told
)");
  EXPECT_NE(run.text.find("kytctl: line 3\n"), std::string::npos) << run.text;
  EXPECT_NE(run.text.find("status 1\n"), std::string::npos) << run.text;
  EXPECT_TRUE(run.text.ends_with("1\n")) << run.text;
}

// The second listener gets no end of the pipe: it would stay open for the sender. Whether the third event reaches it, or
// is written to the connection before its end is seen, is chance.
TEST(SendFromStandardInput, EndsWithAnErrorWhereEventsWereLostWithTheirDaemon) {
  const TemporaryFolder folder;
  const ProgramRun run =
      shell(folder.path(), R"(kytctl listen --socket "$PWD/s" --die-after 2 > told & first=$!
until [ -S s ]; do sleep 0.01; done
mkfifo lines
kytctl send --socket "$PWD/s" --client-type 20 --stdin --timeout 60 < lines > sent 2>&1 & sender=$!
exec 7> lines
printf '{"category":1,"type":1}\n{"category":1,"type":2}\n' >&7
wait $first
kytctl listen --socket "$PWD/s" > again 7>&- & second=$!
until grep -q listening again 2> none; do sleep 0.01; done
echo '{"category":1,"type":3}' >&7
exec 7>&-
wait $sender || echo "status $?"
kill $second; wait $second; cat sent
)");
  EXPECT_TRUE(run.text.starts_with("status 1\n")) << run.text;
  std::smatch lost;
  ASSERT_TRUE(std::regex_search(run.text, lost, std::regex("sent (\\d), lost (\\d), dropped 0\n")))
      << run.text;
  EXPECT_EQ(std::stoi(lost[1]) + std::stoi(lost[2]), 3);
  EXPECT_NE(run.text.find("kytctl: " + lost[2].str() + " events may not have arrived\n"), std::string::npos)
      << run.text;
}

TEST(SendWithoutADaemon, IsQuietWhereItIsToBe) {
  const TemporaryFolder folder;
  const std::string line = "kytctl send --socket \"$PWD/none\" --client-type 20 --category 1 --type 1";
  EXPECT_EQ(shell(folder.path(), line).status, 1);
  const ProgramRun quiet = shell(folder.path(), line + " --quiet-if-no-daemon");
  EXPECT_EQ(quiet.status, 0);
  EXPECT_EQ(quiet.text, "");
}

TEST(SendWithoutADaemon, ReadsWhatItIsGivenSoThatTheProducerLives) {
  const TemporaryFolder folder;
  // More than a pipe holds.
  const ProgramRun run = shell(folder.path(), R"({ head -c 1000000 /dev/zero && echo lives > producer; } |
  kytctl send --socket "$PWD/none" --client-type 20 --stdin --quiet-if-no-daemon
cat producer
)");
  EXPECT_EQ(run.text, "lives\n");
  EXPECT_EQ(run.status, 0);
}

TEST(SendWithoutADaemon, IsNotQuietAboutAWrongInstallation) {
  const TemporaryFolder folder;
  const auto send = [&](const std::string& socket) {
    return shell(folder.path(),
                 "kytctl send --socket \"" + socket +
                     "\" --client-type 20 --category 1 --type 1 --timeout 1 --quiet-if-no-daemon");
  };
  folder.write("file", "");
  const ProgramRun noFolder = send("$PWD/file/socket");
  EXPECT_EQ(noFolder.status, 1);
  EXPECT_NE(noFolder.text.find("/file/socket: Not a directory\n"), std::string::npos) << noFolder.text;
  const ProgramRun tooLong = send("$PWD/" + std::string(200, 'x'));
  EXPECT_EQ(tooLong.status, 1);
  EXPECT_NE(tooLong.text.find("File name too long\n"), std::string::npos) << tooLong.text;
}

class PythonOnAStage : public StageTest {
 protected:
  void SetUp() override {
    if (kSanitized) GTEST_SKIP() << "the interpreter is built without the sanitizer";
    lay();
    putBag("cadmor", {entry("example")});
    startDaemon();
  }
  [[nodiscard]] ProgramRun run(const std::string& text) const {
    return runProgram("env", {"PYTHONPATH=" KYT_SOURCE_DIR "/bindings/python", "PYTHONDONTWRITEBYTECODE=1",
                              "LD_LIBRARY_PATH=" KYT_LIBRARIES, "KYTREPORTING_SOCKET=" + socket(),
                              "/usr/bin/python3", "-c", text});
  }
};

TEST_F(PythonOnAStage, ProgramsOfTheGuideAndTheManualReport) {
  const ProgramRun guide = run(blockOf("PROGRAMS.md", "python example=python"));
  EXPECT_EQ(guide.status, 0) << guide.text;
  const ProgramRun manual = run(exampleOf("kytpython.3", "python"));
  EXPECT_EQ(manual.status, 0) << manual.text;
  EXPECT_TRUE(arrive("client=example&service=demo&method=10&status=1", 2)) << daemonLog();
  EXPECT_TRUE(arrive("client=example&service=demo&method=10&status=2", 1)) << daemonLog();
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
