// kytreportingd: collects telemetry events from client processes and delivers them to reporting back ends.
#include <string>

#include "daemon/Daemon.h"
#include "daemon/DaemonConfigurationCheck.h"
#include "platform/linux/cli/CommandLine.h"

int main(int argc, char** argv) {
  const kyt::CommandLine commandLine(
      "kytreportingd",
      "Collects telemetry events from client processes and delivers them to reporting back ends");
  kyt::DaemonOptions options;
  options.version = kyt::programVersion();
  std::string level;
  bool checkConfig = false;
  commandLine.option("--root", options.root, "A folder that stands in front of every fixed path");
  commandLine.option("--config", options.config,
                     "The settings, instead of /etc/kytreportingd/kytreportingd.toml");
  commandLine
      .option("--log-level", level,
              "From which level on lines are logged, instead of the settings' log.level")
      .oneOf({"debug", "default", "error"});
  commandLine.flag("--check-config", checkConfig, "Say what is wrong with the configuration, and end");
  if (const auto status = commandLine.parse(argc, argv)) return *status;
  if (!level.empty())
    options.logLevel = level == "debug"   ? kyt::LogLevel::debug
                       : level == "error" ? kyt::LogLevel::error
                                          : kyt::LogLevel::normal;
  if (checkConfig) return kyt::checkConfiguration(options);
  return kyt::runDaemon(options);
}
