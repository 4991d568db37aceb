#include "platform/linux/cli/CommandLine.h"

#include <cstdio>
#include <string>

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

void complain(const CLI::App& app, const std::string& what) {
  std::fprintf(stderr, "%s: %s\n", app.get_name().c_str(), escapedText(what).c_str());
}

}  // namespace

const char* programVersion() {
  return KYT_VERSION;
}

void addCommonOptions(CLI::App& app) {
  app.set_help_flag("-h,--help", "Print this help and exit");
  app.set_version_flag("--version", app.get_name() + " " KYT_VERSION, "Print the version and exit");
  app.footer("The manual page " + app.get_name() + " tells more.");
}

std::optional<int> parseCommandLine(CLI::App& app, int argc, char** argv) {
  try {
    app.parse(argc, argv);
    return std::nullopt;
  } catch (const CLI::ParseError& error) {
    if (error.get_exit_code() == 0) return app.exit(error);  // prints the help or the version
    complain(app, error.what());
    std::fprintf(stderr, "Try '%s --help'.\n", understoodCommand(app).c_str());
    return kWrongUsage;
  } catch (const std::exception& error) {
    complain(app, error.what());
    return 1;
  }
}

}  // namespace kyt
