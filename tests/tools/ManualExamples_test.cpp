// The examples of the manual pages work: files are taken, commands and programs run beside a real daemon.
#include <gtest/gtest.h>

#include <csignal>
#include <cstdlib>
#include <regex>
#include <utility>
#include <vector>

#include "platform/linux/confinement/ConfinementProfile.h"
#include "platform/linux/entitlements/TomlEntitlements.h"
#include "platform/linux/toml/FlatToml.h"
#include "platform/linux/toml/TomlSettings.h"
#include "tests/integration/StageFixture.h"
#include "tests/support/Eventually.h"
#include "tests/tools/ManualText.h"

namespace kyt {
namespace {

template <typename Result>
void expectTaken(const Result& result) {
  const auto* error = std::get_if<TomlError>(&result);
  EXPECT_EQ(error, nullptr) << error->text;
}

TEST(ManualExamples, OfFilesAreTaken) {
  expectTaken(parseSettings(exampleOf("kytreportingd.toml.5", "settings"), "settings"));
  const auto grants =
      parseEntitlements(exampleOf("kytreportingd-entitlements.5", "entitlements"), "entitlements");
  expectTaken(grants);
  EXPECT_EQ(std::get<EntitlementGrants>(grants).grants.size(), 2U);
  EXPECT_TRUE(std::get<EntitlementGrants>(grants).problems.empty());
  expectTaken(parseFlatToml(exampleOf("kytreportingd-device.toml.5", "device"), "device"));
  expectTaken(parseFlatToml(exampleOf("kytreportingd-defaults.5", "defaults"), "defaults"));
  const ProfileVariables variables = {{"CONFIG", "/c"}, {"SETTINGS", "/t"}, {"SHARE", "/s"}, {"CA", "/a"},
                                      {"STATE", "/t"},  {"OUTBOX", ""},     {"LOGS", "/l"},  {"RUN", "/r"}};
  expectTaken(parseProfile(exampleOf("kytreportingd-profile.5", "profile"), "profile", variables));
}

TEST(ManualOfTheProfile, NamesEachVariable) {
  const Names variables = matchesIn(textOf("daemon/Daemon.cpp"), "\\{\"([A-Z]+)\", ");
  EXPECT_GE(variables.size(), 7U);
  EXPECT_EQ(matchesIn(itemsOf(sectionOf("kytreportingd-profile.5", "")), "\\$\\{([A-Z]+)\\}"), variables);
}

class ManualExamplesOnAStage : public StageTest {
 protected:
  void SetUp() override {
    tools::Stage::Options options;
    options.serverArguments = {"--udp-port", "0"};
    lay(std::move(options));
    putBag("cadmor", {entry("example")});
    startDaemon();
  }
  // As typed in a shell that finds the programs, and where kytctl means the stage's daemon.
  [[nodiscard]] ProgramRun shell(const std::string& commands) const {
    const std::string prelude = "set -e\nPATH=" KYT_PROGRAMS ":$PATH\nexport KYTREPORTING_SOCKET='" +
                                socket() + "'\ncd '" + stage_->folder() +
                                "'\nkytctl() { command kytctl --root '" + stage_->folder() + "' \"$@\"; }\n";
    return runProgram("sh", {"-c", prelude + commands});
  }
};

TEST_F(ManualExamplesOnAStage, OfKytctlRun) {
  const ProgramRun sent = shell(exampleOf("kytctl.1", "sh send"));
  EXPECT_EQ(sent.text, "finished\n");
  EXPECT_TRUE(arrive("client=example&method=1&status=2", 1)) << daemonLog();
  const ProgramRun session = shell(exampleOf("kytctl.1", "sh session"));
  EXPECT_EQ(session.status, 0) << session.text;
  EXPECT_TRUE(arrive("client=example&method=10", 3)) << daemonLog();
  const ProgramRun defaults = shell(exampleOf("kytctl.1", "sh defaults"));
  EXPECT_EQ(defaults.status, 0) << defaults.text;
  EXPECT_NE(defaults.text.find("environmentType = 2 (integer)\n"), std::string::npos) << defaults.text;
}

// Each line's label, where it has one, and what follows it, with N in place of numbers.
std::vector<std::pair<std::string, std::string>> labelsIn(const std::string& text) {
  constexpr size_t kLabel = 15;
  std::vector<std::pair<std::string, std::string>> labels;
  for (const std::string& line : linesOf(text)) {
    const std::string label = line.substr(0, line.find("  "));
    if (label.empty() || line.size() <= kLabel) continue;
    labels.emplace_back(label,
                        std::regex_replace(line.substr(kLabel), std::regex("[0-9]+([.:][0-9]+)*"), "N"));
  }
  return labels;
}

TEST_F(ManualExamplesOnAStage, OfStatusHasTheLinesThatTheProgramPrints) {
  TestClient listed(socket(), 7, "example"), unlisted(socket(), 7, "other");
  for (TestClient* client : {&listed, &unlisted}) {
    ASSERT_NE(client->configure(), "none");
    EXPECT_TRUE(client->send(1, 2, {}));
  }
  EXPECT_EQ(listed.flush(), "flushed");
  const auto shown = labelsIn(kytctl({"status"}).text), told = labelsIn(exampleOf("kytctl.1", "status"));
  ASSERT_EQ(shown.size(), told.size()) << kytctl({"status"}).text;
  for (size_t i = 0; i < shown.size(); ++i) {
    EXPECT_EQ(shown[i].first, told[i].first);
    const bool isOfFigures =
        told[i].first != "back ends" && told[i].first != "storebags" && told[i].first != "servers";
    if (isOfFigures) {
      EXPECT_EQ(shown[i].second, told[i].second);
    }
  }
}

TEST_F(ManualExamplesOnAStage, OfWatchHasTheColumnsThatTheProgramPrints) {
  const std::vector<std::string> told = linesOf(exampleOf("kytctl.1", "watch"));
  const TemporaryFolder folder;
  tools::ChildProcess::Options how;
  how.outputFile = folder / "output";
  const auto watch =
      tools::ChildProcess::start(stage_->program("kytctl"), {"--root", stage_->folder(), "watch"}, how);
  ASSERT_TRUE(watch);
  ASSERT_TRUE(eventually([&] { return folder.read("output").ends_with("\n"); }));
  EXPECT_EQ(linesOf(folder.read("output")).at(0), told.at(0));
  TestClient client(socket(), 7, "example");
  ASSERT_EQ(client.configure(), "live: httppost");
  EXPECT_TRUE(client.send(1, 2, {}));
  EXPECT_EQ(client.flush(), "flushed");
  ASSERT_TRUE(eventually([&] { return linesOf(folder.read("output")).size() > 2; }));
  std::vector<std::string> rows(told.begin() + 1, told.end());
  rows.push_back(linesOf(folder.read("output")).at(2));
  const std::regex row(R"([0-9:]{8}  [ 0-9]{7}  .{14}  .{8}  [0-9]+/[0-9]+ {4,10}[a-z-]+(: [a-z0-9-]+)?)");
  for (const std::string& line : rows) EXPECT_TRUE(std::regex_match(line, row)) << line;
}

TEST_F(ManualExamplesOnAStage, OfExplainInTheProgrammersGuideRuns) {
  const ProgramRun run = shell(blockOf("PROGRAMS.md", "sh example=explain"));
  EXPECT_EQ(run.status, 0) << run.text;
  EXPECT_NE(run.text.find("the event leaves"), std::string::npos) << run.text;
  EXPECT_EQ(kytctl({"sessions", "--json"}).text, "{\"sessions\":[],\"all\":0}\n") << "nothing was sent";
}

TEST_F(ManualExamplesOnAStage, OfTheStorebagRun) {
  ASSERT_FALSE(tools::writeFile(stage_->folder() + "/dulvek.toml",
                                exampleOf("kytreportingd-storebag.5", "storebag"), 0644));
  const ProgramRun run = shell(exampleOf("kytreportingd-storebag.5", "sh storebag"));
  EXPECT_EQ(run.status, 0) << run.text;
  EXPECT_NE(run.text.find("\"client\": \"example\""), std::string::npos) << run.text;
  EXPECT_EQ(run.text.find("warning"), std::string::npos) << run.text;
}

TEST_F(ManualExamplesOnAStage, OfWhatAProgramReportsRun) {
  for (const auto& [name, text] :
       {std::pair("events.toml", exampleOf("kytreporting-events.toml.5", "events")),
        std::pair("dulvek.toml", exampleOf("kytreportingd-storebag.5", "storebag"))})
    ASSERT_FALSE(tools::writeFile(stage_->folder() + "/" + name, text, 0644));
  const ProgramRun check = shell(exampleOf("kytreporting-events.toml.5", "sh check"));
  EXPECT_EQ(check.status, 0) << check.text;
  EXPECT_EQ(check.text, "events.toml: nothing found; events: 1, fields: 3\n");
}

TEST_F(ManualExamplesOnAStage, OfTheFeedRuns) {
  const std::string port = std::to_string(stage_->udpPort());
  const ProgramRun run = shell(
      std::regex_replace(exampleOf("kytfeed.1", "sh feed"), std::regex("--port 4000"), "--port " + port));
  EXPECT_EQ(run.status, 0) << run.text;
  EXPECT_NE(run.text.find(" key=value\n"), std::string::npos) << run.text;
}

// In the foreground, as the page says, until it is told to end.
TEST_F(ManualExamplesOnAStage, OfTheDaemonRuns) {
  std::string commands = exampleOf("kytreportingd.8", "sh daemon");
  const std::string installed = "/usr/share/kytreporting";
  commands.replace(commands.find(installed), installed.size(), KYT_SHARE "/kytreporting");
  commands.pop_back();
  commands +=
      " & until [ -S root/run/kytreportingd/com.vantu.kytreportingd ]; do kill -0 $!; sleep 0.05; done\n"
      "kill $!; wait $!\n";
  const ProgramRun run = shell(commands);
  EXPECT_EQ(run.status, 0) << run.text;
  EXPECT_NE(run.text.find("start loop"), std::string::npos) << run.text;
}

// The guide for those who ship a fleet, as typed.
TEST_F(ManualExamplesOnAStage, OfTheFleetsGuideRun) {
  ASSERT_FALSE(tools::writeFile(stage_->folder() + "/dulvek.toml", blockOf("FLEET.md", "toml"), 0644));
  std::string commands = "kytctl keys make keys/\n";
  for (const std::string& line : linesOf(textOf("docs/FLEET.md")))
    if (line.starts_with("    ")) commands += line + "\n";
  const ProgramRun run = shell(commands);
  EXPECT_EQ(run.status, 0) << run.text;
  EXPECT_NE(run.text.find("\"sampling_threshold\": 0.1"), std::string::npos) << run.text;
  EXPECT_EQ(run.text.find("warning"), std::string::npos) << run.text;
}

// The compiler, the flags and the library of this build.
class ManualProgramsOnAStage : public ManualExamplesOnAStage {
 protected:
  [[nodiscard]] std::string compile(const std::string& name, const std::string& language,
                                    const std::string& text) const {
    const std::string program = stage_->folder() + "/" + name, source = program + ".source";
    if (auto error = tools::writeFile(source, text, 0644)) return error->localizedDescription;
    return shell(std::string(KYT_CXX " " KYT_USER_FLAGS " -Wall -Wextra -Werror -x ") + language +
                 (language == "c" ? " -std=c11" : " -std=c++20") +
                 " -I" KYT_SOURCE_DIR "/client/include -I" KYT_SOURCE_DIR " " + source +
                 " -x none -L" KYT_LIBRARIES " -lkytreporting -Wl,-rpath," KYT_LIBRARIES " -o " + program)
        .text;
  }
};

TEST_F(ManualProgramsOnAStage, OfTheLibraryCompileAndReport) {
  for (const auto& [name, language] : {std::pair("c", "c"), std::pair("cpp", "c++")}) {
    ASSERT_EQ(compile(name, language, exampleOf("libkytreporting.3", name)), "");
    const ProgramRun run = shell(stage_->folder() + "/" + name);
    EXPECT_EQ(run.status, 0) << run.text;
    EXPECT_EQ(run.text, std::string(name) == "c" ? "live: httppost\n" : "");
  }
  EXPECT_TRUE(arrive("client=example&method=10&status=1", 2)) << daemonLog();
}

TEST_F(ManualProgramsOnAStage, OfEventsWithNamesCompilesAndReports) {
  ASSERT_FALSE(tools::writeFile(stage_->folder() + "/events.toml",
                                exampleOf("kytreporting-events.toml.5", "events"), 0644));
  ASSERT_EQ(shell("kytctl events generate events.toml --lang c++ -o events.h").text, "");
  ASSERT_EQ(compile("events", "c++", exampleOf("kytreporting-events.toml.5", "program")), "");
  EXPECT_EQ(shell(stage_->folder() + "/events").status, 0);
  EXPECT_TRUE(arrive("client=example&service=demo&method=10&status=1", 1)) << daemonLog();
}

TEST_F(ManualProgramsOnAStage, OfTheProgrammersGuideCompileAndReport) {
  ASSERT_EQ(compile("guide", "c++",
                    "#include <kytreporting/KYTReporting.h>\nint main() {\n" + blockOf("PROGRAMS.md", "cpp") +
                        "}\n"),
            "");
  EXPECT_EQ(shell("./guide").status, 0);
  EXPECT_TRUE(arrive("client=example&service=demo&method=10", 1)) << daemonLog();
}

// With all that it leaves to the reader: the word is made, and the handler set.
TEST_F(ManualProgramsOnAStage, OfTheLastWordIsSentAndEndsAsWithoutIt) {
  ASSERT_EQ(compile("crash", "c",
                    "#include <kytreporting/kytreporting.h>\n#include <signal.h>\n#include <stdlib.h>\n" +
                        blockOf("PROGRAMS.md", "c example=last-word") + R"(
int main(int count, char** arguments) {
  kyt_dictionary* info = kyt_dictionary_new();
  kyt_dictionary_set_int(info, "ClientType", 20);
  kyt_dictionary_set_int(info, "SessionID", 7);
  kyt_dictionary_set_bool(info, "RequireUserInfo", 1);
  kyt_dictionary* user = kyt_dictionary_new();
  kyt_dictionary_set_string(user, "ClientName", "example");
  kyt_dictionary_set_string(user, "ServiceName", "crash");
  kyt_options options = {.size = sizeof options, .session_info = info, .user_info = user};
  crashed = kyt_last_word_new(&options, 10, count > 1 ? (uint32_t)atoi(arguments[1]) : 0, NULL);
  signal(SIGSEGV, on_crash);
  signal(SIGABRT, on_crash);
  raise(atoi(arguments[1]));
  return 0;
}
)"),
            "");
  constexpr int kBySignal = 128;
  for (const int number : {SIGSEGV, SIGABRT}) {
    const ProgramRun run = shell("ulimit -c 0\n./crash " + std::to_string(number) + " || exit $?");
    EXPECT_EQ(run.status, kBySignal + number) << run.text;
    EXPECT_TRUE(arrive("client=example&service=crash&method=10&status=" + std::to_string(number), 1))
        << daemonLog();
  }
}

}  // namespace
}  // namespace kyt
