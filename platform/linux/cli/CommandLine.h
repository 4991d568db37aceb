// What the command lines of all programs have in common: --help and --version, the form of errors, and the
// exit status of wrong usage. Used by every main(); the completions and the manual pages are compared with
// what this prints.
#pragma once

#include <CLI/CLI.hpp>
#include <optional>

namespace kyt {

inline constexpr int kWrongUsage = 2;

// What --version says behind the name.
[[nodiscard]] const char* programVersion();

// Gives the program --help and --version. To be called before subcommands are added, which take --help over.
void addCommonOptions(CLI::App& app);

// The exit status to end with: 0 when help or the version was printed, 2 when the command line is wrong, which
// is said on standard error, 1 when a command could not be carried out for want of memory or the like. None:
// the program goes on.
[[nodiscard]] std::optional<int> parseCommandLine(CLI::App& app, int argc, char** argv);

}  // namespace kyt
