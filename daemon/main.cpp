// kytreportingd: collects telemetry events from client processes and delivers them to reporting back ends.
#include <string>

#include "daemon/Daemon.h"
#include "platform/linux/cli/CommandLine.h"

int main(int argc, char** argv) {
  CLI::App app("Collects telemetry events from client processes and delivers them to reporting back ends",
               "kytreportingd");
  kyt::DaemonOptions options;
  std::string level = "default";
  kyt::addCommonOptions(app);
  app.add_option("--root", options.root, "A folder that stands in front of every fixed path");
  app.add_option("--config", options.config,
                 "The settings, instead of /etc/kytreportingd/kytreportingd.toml");
  app.add_option("--log-level", level, "From which level on lines are logged")
      ->check(CLI::IsMember({"debug", "default", "error"}))
      ->capture_default_str();
  if (const auto status = kyt::parseCommandLine(app, argc, argv)) return *status;
  options.logLevel = level == "debug"   ? kyt::LogLevel::debug
                     : level == "error" ? kyt::LogLevel::error
                                        : kyt::LogLevel::normal;
  return kyt::runDaemon(options);
}
