// What bash, zsh and fish complete is what the programs' help names.
#include <gtest/gtest.h>

#include "tests/support/Sanitizers.h"
#include "tests/tools/ManualText.h"

namespace kyt {
namespace {

const std::string kFolder = KYT_SOURCE_DIR "/packaging/completion";
const std::string kWithPrograms = "PATH=" KYT_PROGRAMS ":$PATH\n";

// As bash calls a completion function: with its five variables set.
const std::string kDrive = R"(
line=$1
source "$2"
COMP_LINE=$line COMP_POINT=${#line} COMP_TYPE=9 COMP_KEY=9
read -ra COMP_WORDS <<<"${line//[:=]/ & }"
[[ $line == *" " ]] && COMP_WORDS+=("")
COMP_CWORD=$((${#COMP_WORDS[@]} - 1))
_kyt "${COMP_WORDS[0]}" "${COMP_WORDS[COMP_CWORD]}" "${COMP_WORDS[COMP_CWORD-1]}"
printf '%s\n' "${COMPREPLY[@]}"
)";

constexpr const char* kPrograms[] = {
    "kytctl",  "kytreportingd",   "kytreader",         "kytreceiver",     "kytdevserver",       "kytfeed",
    "kytdemo", "kytsource-units", "kytsource-crashes", "kytsource-boots", "kytsource-resources"};

class Shell {
 public:
  virtual ~Shell() = default;
  [[nodiscard]] virtual bool isInstalled() const = 0;
  [[nodiscard]] virtual ProgramRun complete(const std::string& line) const = 0;
};

class Bash final : public Shell {
 public:
  explicit Bash(std::string prelude) : prelude_(std::move(prelude)) {}
  [[nodiscard]] bool isInstalled() const override {
    return prelude_.empty() || runProgram("bash", {"-c", prelude_}).status == 0;
  }
  [[nodiscard]] ProgramRun complete(const std::string& line) const override {
    return runProgram("bash",
                      {"-c", kWithPrograms + prelude_ + kDrive, "bash", line, kFolder + "/bash/kytctl"});
  }

 private:
  const std::string prelude_;
};

class Zsh final : public Shell {
 public:
  [[nodiscard]] bool isInstalled() const override { return kyt::isInstalled("zsh"); }
  [[nodiscard]] ProgramRun complete(const std::string& line) const override {
    return runProgram("sh", {"-c", kWithPrograms + "exec zsh -f \"$@\"", "sh",
                             KYT_SOURCE_DIR "/tests/tools/zsh-complete", kFolder + "/zsh", line});
  }
};

class Fish final : public Shell {
 public:
  [[nodiscard]] bool isInstalled() const override { return kyt::isInstalled("fish"); }
  // It has a command that answers what its tab key would, each with a tab and a description.
  [[nodiscard]] ProgramRun complete(const std::string& line) const override {
    const std::string program = line.substr(0, line.find(' '));
    return runProgram(
        "sh", {"-c",
               kWithPrograms +
                   "fish --no-config -c 'source $argv[1]; complete -C $argv[2]' \"$@\" 2>/dev/null | cut -f1",
               "sh", kFolder + "/fish/" + program + ".fish", line});
  }
};

const Bash kBash("");
const Bash kBashWithItsPackage("source /usr/share/bash-completion/bash_completion || exit 1\n");
const Zsh kZsh;
const Fish kFish;

struct Kind {
  const char* name;
  const Shell& shell;
};

class Completion : public ::testing::TestWithParam<Kind> {
 protected:
  void SetUp() override {
    if (kSanitized) GTEST_SKIP() << "shells and help are the same in every build";
    if (!GetParam().shell.isInstalled()) GTEST_SKIP() << GetParam().name << " is not installed";
  }
  static Names after(const std::string& line) {
    const ProgramRun run = GetParam().shell.complete(line);
    EXPECT_EQ(run.status, 0) << run.text;
    Names words;
    for (const std::string& word : linesOf(run.text))
      if (!word.empty()) words.insert(word);
    return words;
  }
  // Options, subcommands and fixed values, downwards.
  static void expectWhatHelpNames(const std::string& program, const std::vector<std::string>& path = {}) {
    std::string line = program;
    for (const std::string& command : path) line += " " + command;
    const Help help = helpOf(program, path);
    Names options = help.options;
    if (!path.empty()) options.insert("--root");
    EXPECT_EQ(after(line + " -"), options) << line;
    if (!help.commands.empty()) {
      EXPECT_EQ(after(line + " "), help.commands) << line;
    }
    for (const auto& [option, values] : help.values)
      EXPECT_EQ(after(line + " " + option + " "), values) << line;
    for (const std::string& command : help.commands) {
      std::vector<std::string> deeper = path;
      deeper.push_back(command);
      expectWhatHelpNames(program, deeper);
    }
  }

  TemporaryFolder folder_;
};

TEST_P(Completion, KnowsTheOptionsCommandsAndValuesThatHelpNames) {
  for (const char* program : kPrograms) expectWhatHelpNames(program);
}

// Of a program, or one of its commands, and all below it.
void addFlags(Names& flags, const std::string& program, const std::vector<std::string>& path = {}) {
  const Help help = helpOf(program, path);
  flags.insert(help.flags.begin(), help.flags.end());
  for (const std::string& command : help.commands) {
    std::vector<std::string> deeper = path;
    deeper.push_back(command);
    addFlags(flags, program, deeper);
  }
}

// The others are told by their commands' options; bash takes the word behind any other option for its value.
TEST(CompletionOfBash, KnowsWhichOptionsTakeNoValue) {
  Names flags = {"--help"};
  for (const char* program : kPrograms) addFlags(flags, program);
  const std::string text = textOf("packaging/completion/bash/kytctl");
  const size_t begin = text.find("_kyt_is_flag() {");
  ASSERT_NE(begin, std::string::npos);
  EXPECT_EQ(matchesIn(text.substr(begin, text.find("\n}\n", begin) - begin), "(--[a-z][a-z-]*)"), flags);
}

TEST_P(Completion, KnowsTheDomainsAndKeysThatAreReadable) {
  const std::string defaults = folder_.path() + "/var/lib/kytreportingd/defaults";
  std::filesystem::create_directories(defaults);
  folder_.write("var/lib/kytreportingd/defaults/org.example.toml", "first = 1\n\"uuid:a:b\" = \"x\"\n");
  const std::string command = "kytctl --root " + folder_.path() + " defaults ";
  EXPECT_EQ(after(command + "read "),
            (Names{"com.vantu.diagnostics", "com.vantu.kytreporting", "com.vantu.timed", "org.example"}));
  EXPECT_EQ(after(command + "delete org.example "), (Names{"first", "uuid:a:b"}));
  EXPECT_EQ(after(command + "read org.example f"), Names{"first"});
  EXPECT_EQ(after(command + "read no.such.domain "), Names{});
}

TEST_P(Completion, KnowsFilesAndFolders) {
  folder_.write("bag.toml", "");
  std::filesystem::create_directories(folder_.path() + "/bags");
  const auto ends = [](const Names& words) {
    Names last;
    for (std::string word : words) {
      if (word.ends_with('/')) word.pop_back();
      last.insert(word.substr(word.rfind('/') + 1));
    }
    return last;
  };
  const std::string begin = folder_.path() + "/ba";
  EXPECT_EQ(ends(after("kytctl storebag sign " + begin)), (Names{"bag.toml", "bags"}));
  EXPECT_EQ(ends(after("kytdevserver --bags " + begin)), Names{"bags"});
  EXPECT_EQ(ends(after("kytreportingd --config " + begin)), (Names{"bag.toml", "bags"}));
}

INSTANTIATE_TEST_SUITE_P(Shells, Completion,
                         ::testing::Values(Kind{"bash", kBash},
                                           Kind{"bashWithItsPackage", kBashWithItsPackage}, Kind{"zsh", kZsh},
                                           Kind{"fish", kFish}),
                         [](const auto& test) { return std::string(test.param.name); });

}  // namespace
}  // namespace kyt
