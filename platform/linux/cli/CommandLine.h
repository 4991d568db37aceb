// The command lines of all programs: options, arguments and commands, --help and --version, the form of errors, and the
// exit status of wrong usage. Used by every main(); the completions and the manual pages are compared with what this
// prints. One thread. What options are read into, and what names and helps point to, outlives the parse.
//
// CLI11 does the work, in CommandLine.cpp alone: each file that includes it takes seconds to compile.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace CLI {
class App;
class Option;
}  // namespace CLI

namespace kyt {

inline constexpr int kWrongUsage = 2;

// What --version says behind the name.
[[nodiscard]] const char* programVersion();

// An option or an argument that was added; valid as long as its command line.
class CommandOption {
 public:
  explicit CommandOption(CLI::Option& option) : option_(option) {}
  CommandOption required() const;
  CommandOption showsDefault() const;  // the help names what stands in the target now
  template <typename Number>           // int, double
  CommandOption between(Number lowest, Number highest) const;
  CommandOption oneOf(std::vector<std::string> words) const;
  CommandOption excludes(CommandOption other) const;
  CommandOption notEmpty() const;  // a text without a character is wrong usage, as it always is for a number
  CommandOption repeatable() const;  // of a list: one value each time that it is given

 private:
  CLI::Option& option_;
};

// A program's whole command line, or a command below it.
class Command {
 public:
  explicit Command(CLI::App& app) : app_(app) {}
  // "--name", "-n,--name", or "name" for an argument in its place. The target is one of the types that CommandLine.cpp
  // lists: texts, lists of them, paths, numbers.
  template <typename Target>
  CommandOption option(const char* name, Target& target, const char* help) const;
  CommandOption flag(const char* name, bool& target, const char* help) const;
  [[nodiscard]] Command command(const char* name, const char* help) const;
  void needsCommand() const;                    // exactly one of those below it
  void runs(std::function<void()> work) const;  // during the parse, once this command has been read
  void ends(const char* footer) const;          // the last paragraph of its help

 private:
  CLI::App& app_;
};

class CommandLine : public Command {
 public:
  CommandLine(const char* program, const char* description);
  ~CommandLine();
  CommandLine(const CommandLine&) = delete;
  CommandLine& operator=(const CommandLine&) = delete;
  // Its own options are also read behind a command.
  void takesOptionsAnywhere() const;
  // The exit status to end with: 0 when help or the version was printed, 2 when the command line is wrong, which
  // is said on standard error, 1 when a command could not be carried out for want of memory or the like. None:
  // the program goes on.
  [[nodiscard]] std::optional<int> parse(int argc, char** argv) const;

 private:
  explicit CommandLine(std::unique_ptr<CLI::App> app);
  std::unique_ptr<CLI::App> app_;
};

}  // namespace kyt
