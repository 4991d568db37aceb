// What the command lines of all programs have in common.
#include <gtest/gtest.h>

#include "tests/support/Programs.h"

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

}  // namespace
}  // namespace kyt
