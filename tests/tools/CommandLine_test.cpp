// What the command lines of all programs have in common.
#include <gtest/gtest.h>

#include <string>
#include <utility>
#include <vector>

#include "tests/support/Programs.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt {
namespace {

bool has(const std::string& text, const std::string& part) {
  return text.find(part) != std::string::npos;
}

class CommandLine : public ::testing::TestWithParam<const char*> {
 protected:
  [[nodiscard]] static ProgramRun run(const std::vector<std::string>& arguments) {
    return runProgram(std::string(KYT_PROGRAMS) + "/" + GetParam(), arguments);
  }
};

TEST_P(CommandLine, TellsTheVersion) {
  const ProgramRun told = run({"--version"});
  EXPECT_EQ(told.status, 0);
  EXPECT_EQ(told.text, std::string(GetParam()) + " " KYT_VERSION "\n");
}

TEST_P(CommandLine, HelpsOnStandardOutput) {
  for (const char* option : {"--help", "-h"}) {
    const ProgramRun help = run({option});
    EXPECT_EQ(help.status, 0);
    EXPECT_TRUE(has(help.text, std::string("Usage: ") + GetParam() + " ")) << help.text;
    EXPECT_TRUE(has(help.text, "--version")) << help.text;
  }
}

TEST_P(CommandLine, SaysWhichArgumentItDoesNotKnow) {
  const std::string name = GetParam();
  const ProgramRun wrong = run({"--no-such-option\x1b[2J"});
  EXPECT_EQ(wrong.status, 2);
  EXPECT_TRUE(wrong.text.starts_with(name + ": ")) << wrong.text;
  EXPECT_TRUE(has(wrong.text, "Try '" + name + " --help'.\n")) << wrong.text;
  EXPECT_FALSE(has(wrong.text, "\x1b")) << "control characters are escaped";
}

INSTANTIATE_TEST_SUITE_P(Programs, CommandLine,
                         ::testing::Values("kytreportingd", "kytctl", "kytdevserver", "kytfeed", "kytdemo"),
                         [](const auto& test) { return std::string(test.param); });

TEST(CommandLineOfKytctl, HintsAtTheHelpOfTheCommandThatWasMeant) {
  const ProgramRun wrong = runProgram(KYT_PROGRAMS "/kytctl", {"defaults", "write", "domain"});
  EXPECT_EQ(wrong.status, 2);
  EXPECT_EQ(wrong.text, "kytctl: key is required\nTry 'kytctl defaults write --help'.\n");
}

TEST(CommandLineOfKytctl, NamesACommandThatThereIsNot) {
  for (const auto& [command, of] : std::vector<std::pair<std::vector<std::string>, std::string>>{
           {{"stauts", "--json"}, "kytctl"}, {{"consent", "stauts"}, "kytctl consent"}}) {
    const ProgramRun wrong = runProgram(KYT_PROGRAMS "/kytctl", command);
    EXPECT_EQ(wrong.status, 2);
    EXPECT_EQ(wrong.text, "kytctl: there is no command stauts\nTry '" + of + " --help'.\n");
  }
  EXPECT_EQ(runProgram(KYT_PROGRAMS "/kytctl", {}).text,
            "kytctl: A subcommand is required\nTry 'kytctl --help'.\n");
}

TEST(CommandLineOfKytctl, TakesNoValueOfAnOptionThatThereIsNotForACommand) {
  for (const auto& [command, of] : std::vector<std::pair<std::vector<std::string>, std::string>>{
           {{"--rot", "/tmp"}, "kytctl"}, {{"consent", "--rot", "/tmp", "stauts"}, "kytctl consent"}})
    EXPECT_EQ(runProgram(KYT_PROGRAMS "/kytctl", command).text,
              "kytctl: there is no option --rot without a command\nTry '" + of + " --help'.\n");
}

TEST(CommandLineOfKytctl, EndsWithAnErrorWhenItCannotWrite) {
  const TemporaryFolder root;
  const std::string program = std::string("'") + KYT_PROGRAMS "/kytctl' --root '" + root.path() + "' ";
  const std::pair<const char*, int> commands[] = {{"--help", 1},
                                                  {"--version", 1},
                                                  {"explain --help", 1},
                                                  {"explain '{\"Category\":1,\"Type\":1}' --json", 2},
                                                  {"explain '{\"Category\":1,\"Type\":1}'", 2},
                                                  {"entitlements check --user 0", 2},
                                                  {"consent show", 1},
                                                  {"owner show", 1},
                                                  {"owner show --json", 1},
                                                  {"owner export -", 1},
                                                  {"ring", 1}};
  for (const auto& [command, status] : commands) {
    const ProgramRun run = runProgram("sh", {"-c", program + command + " >/dev/full"});
    EXPECT_EQ(run.status, status) << command;
    EXPECT_TRUE(has(run.text, "kytctl: can't write the output")) << command << ": " << run.text;
  }
}

// What is left of an option where a script's variable is not set: it would watch, explain or drop what nobody meant.
TEST(CommandLineOfKytctl, RefusesAnEmptyValueWhereItMeansNothing) {
  const std::vector<std::string> commands[] = {
      {"watch", "--user", ""},
      {"watch", "--category", ""},
      {"explain", "{}", "--client-type", ""},
      {"explain", "{}", "--draw", ""},
      {"explain", "{}", "--user", ""},
      {"explain", "{}", "--user", "0", "--program", ""},
      {"explain", "{}", "--storebag", ""},
      {"entitlements", "check", "--user", ""},
      {"send", "--client-type", "7", "--category", ""},
      {"storebag", "sign", "bag.json", "--key", "key.pem", "-o", "out", "--serial", ""},
      {"ring", "--set", ""},
      {"ring", "--identifier", ""},
      {"outbox", "drop", "--server", "https://a.example", "--user", ""},
      {"outbox", "drop", "--user", "0", "--server", ""}};
  const TemporaryFolder root;
  for (const auto& command : commands) {
    std::vector<std::string> arguments{"--root", root.path()};
    arguments.insert(arguments.end(), command.begin(), command.end());
    const ProgramRun wrong = runProgram(KYT_PROGRAMS "/kytctl", arguments);
    EXPECT_EQ(wrong.status, 2) << wrong.text;
    EXPECT_TRUE(has(wrong.text, " is empty\nTry 'kytctl ")) << command[0] << ": " << wrong.text;
  }
}

TEST(CommandLineOfKytctl, TakesNoNumberThatIsNotMeant) {
  const std::pair<std::vector<std::string>, const char*> commands[] = {
      {{"listen", "--socket", "/nonexistent/s", "--die-after", "-1"}, "-1 is negative"},
      {{"listen", "--socket", "/nonexistent/s", "--die-after", " -1"}, " -1 is negative"},
      {{"listen", "--socket", "/nonexistent/s", "--die-after", "18446744073709551616"},
       "18446744073709551616 is too large"},
      {{"send", "--client-type", "7", "--category", "1", "--type", "1", "--session-id=-18446744073709551615"},
       "-18446744073709551615 is negative"},
      {{"watch", "--category=-18446744073709551615"}, "-18446744073709551615 is negative"},
      {{"explain", "{}", "--draw", "nan"}, "nan is no number"},
      {{"send", "--client-type", "7", "--category", "1", "--type", "1", "--timeout", "nan"},
       "nan is no number"}};
  const TemporaryFolder root;
  for (const auto& [command, text] : commands) {
    std::vector<std::string> arguments{"--root", root.path()};
    arguments.insert(arguments.end(), command.begin(), command.end());
    const ProgramRun wrong = runProgram(KYT_PROGRAMS "/kytctl", arguments);
    EXPECT_EQ(wrong.status, 2) << wrong.text;
    EXPECT_TRUE(has(wrong.text, std::string(": ") + text + "\nTry 'kytctl " + command[0] + " --help'.\n"))
        << wrong.text;
  }
  EXPECT_TRUE(has(runProgram(KYT_PROGRAMS "/kytctl",
                             {"listen", "--socket", "/nonexistent/s", "--die-after", "18446744073709551615"})
                      .text,
                  "/nonexistent/s"))
      << "the largest one is taken";
}

}  // namespace
}  // namespace kyt
