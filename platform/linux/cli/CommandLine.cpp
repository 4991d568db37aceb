#include "platform/linux/cli/CommandLine.h"

#include <CLI/CLI.hpp>
#include <cerrno>
#include <chrono>
#include <cmath>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <type_traits>
#include <utility>

#include "platform/base/TextEscape.h"

namespace kyt {

namespace {

// "kytctl defaults write": as far as the command line was understood, so that the hint leads to the right help.
std::string understoodCommand(const CLI::App& app) {
  std::string text = app.get_name();
  for (const CLI::App* at = &app; !at->get_subcommands().empty();) {
    at = at->get_subcommands().front();
    text += " " + at->get_name();
  }
  return text;
}

const CLI::App& understood(const CLI::App& app) {
  const CLI::App* at = &app;
  while (!at->get_subcommands().empty()) at = at->get_subcommands().front();
  return *at;
}

// Where a command is wanted and something else stands: CLI11 says only that one is wanted. What is behind an option that
// nobody knows may be its value.
std::optional<std::string> unknownCommand(const CLI::App& app) {
  if (understood(app).get_require_subcommand_min() == 0) return std::nullopt;
  const std::vector<std::string> words = app.remaining(true);
  if (words.empty()) return std::nullopt;
  if (words.front().starts_with('-')) return "there is no option " + words.front() + " without a command";
  return "there is no command " + words.front();
}

void complain(const CLI::App& app, const std::string& what) {
  std::fprintf(stderr, "%s: %s\n", app.get_name().c_str(), escapedText(what).c_str());
}

// What an option's text becomes.
template <typename Target>
struct ValueOf {
  using Type = Target;
};
template <typename Target>
struct ValueOf<std::optional<Target>> {
  using Type = Target;
};

// Says of a text that CLI11 would make another number of it; empty where it would not.
template <typename Number>
std::string mistakenNumber(const std::string& text) {
  if constexpr (std::is_unsigned_v<Number>)
    if (text.find('-') != std::string::npos) return text + " is negative";  // it adds 2^64
  if constexpr (std::is_floating_point_v<Number>) {
    // No comparison finds it outside a range.
    if (std::isnan(std::strtod(text.c_str(), nullptr))) return text + " is no number";
  } else {
    errno = 0;
    if constexpr (std::is_unsigned_v<Number>)
      static_cast<void>(std::strtoull(text.c_str(), nullptr, 0));
    else
      static_cast<void>(std::strtoll(text.c_str(), nullptr, 0));
    if (errno == ERANGE) return text + " is too large";  // it takes the largest one
  }
  return {};
}

}  // namespace

const char* programVersion() {
  return KYT_VERSION;
}

CommandOption CommandOption::required() const {
  option_.required();
  return *this;
}

CommandOption CommandOption::showsDefault() const {
  option_.capture_default_str();
  return *this;
}

template <typename Number>
CommandOption CommandOption::between(Number lowest, Number highest) const {
  option_.check(CLI::Range(lowest, highest));
  return *this;
}
template CommandOption CommandOption::between(int, int) const;
template CommandOption CommandOption::between(double, double) const;

CommandOption CommandOption::oneOf(std::vector<std::string> words) const {
  option_.check(CLI::IsMember(std::move(words)));
  return *this;
}

CommandOption CommandOption::excludes(CommandOption other) const {
  option_.excludes(&other.option_);
  return *this;
}

// What a script's unset variable leaves of an option is not what the option's absence means.
CommandOption CommandOption::notEmpty() const {
  option_.check([](const std::string& value) { return std::string(value.empty() ? "is empty" : ""); });
  return *this;
}

CommandOption CommandOption::repeatable() const {
  option_.allow_extra_args(false);
  return *this;
}

// CLI11 takes an empty text for the number 0.
template <typename Target>
CommandOption Command::option(const char* name, Target& target, const char* help) const {
  CLI::Option* made = app_.add_option(name, target, help);
  const CommandOption option(*made);
  using Value = typename ValueOf<Target>::Type;
  if constexpr (std::is_arithmetic_v<Value>) {
    static_cast<void>(option.notEmpty());
    made->check([](const std::string& text) { return mistakenNumber<Value>(text); });
  }
  return option;
}
template CommandOption Command::option(const char*, std::string&, const char*) const;
template CommandOption Command::option(const char*, std::optional<std::string>&, const char*) const;
template CommandOption Command::option(const char*, std::vector<std::string>&, const char*) const;
template CommandOption Command::option(const char*, std::filesystem::path&, const char*) const;
template CommandOption Command::option(const char*, uint16_t&, const char*) const;
template CommandOption Command::option(const char*, std::optional<uint16_t>&, const char*) const;
template CommandOption Command::option(const char*, int32_t&, const char*) const;
template CommandOption Command::option(const char*, std::optional<int32_t>&, const char*) const;
template CommandOption Command::option(const char*, uint32_t&, const char*) const;
template CommandOption Command::option(const char*, std::optional<uint32_t>&, const char*) const;
template CommandOption Command::option(const char*, uint64_t&, const char*) const;
template CommandOption Command::option(const char*, double&, const char*) const;

CommandOption Command::flag(const char* name, bool& target, const char* help) const {
  return CommandOption(*app_.add_flag(name, target, help));
}

Command Command::command(const char* name, const char* help) const {
  return Command(*app_.add_subcommand(name, help));
}

void Command::needsCommand() const {
  app_.require_subcommand(1);
}

void Command::runs(std::function<void()> work) const {
  app_.callback(std::move(work));
}

void Command::ends(const char* footer) const {
  app_.footer(footer);
}

// Help and version come before commands are added, which take the help over.
CommandLine::CommandLine(const char* program, const char* description)
    : CommandLine(std::make_unique<CLI::App>(description, program)) {
  app_->set_help_flag("-h,--help", "Print this help and exit");
  app_->set_version_flag("--version", app_->get_name() + " " + programVersion(),
                         "Print the version and exit");
  app_->footer("The manual page " + app_->get_name() + " tells more.");
}

CommandLine::CommandLine(std::unique_ptr<CLI::App> app) : Command(*app), app_(std::move(app)) {}

CommandLine::~CommandLine() = default;

void CommandLine::takesOptionsAnywhere() const {
  app_->fallthrough();
}

std::optional<int> CommandLine::parse(int argc, char** argv) const {
  try {
    app_->parse(argc, argv);
    return std::nullopt;
  } catch (const CLI::ParseError& error) {
    if (error.get_exit_code() == 0) return app_->exit(error);  // prints the help or the version
    complain(*app_, unknownCommand(*app_).value_or(error.what()));
    std::fprintf(stderr, "Try '%s --help'.\n", understoodCommand(*app_).c_str());
    return kWrongUsage;
  } catch (const std::exception& error) {
    complain(*app_, error.what());
    return 1;
  }
}

}  // namespace kyt
