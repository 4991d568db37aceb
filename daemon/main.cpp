// kytreportingd: collects telemetry events from client processes and delivers them to reporting back ends.
#include <CLI/CLI.hpp>
#include <string>

#include "daemon/Daemon.h"

int main(int argc, char** argv) {
  CLI::App app("Collects telemetry events from client processes and delivers them to reporting back ends.",
               "kytreportingd");
  kyt::DaemonOptions options;
  std::string level = "default";
  app.add_option("--root", options.root, "A folder that stands in front of every fixed path");
  app.add_option("--config", options.config, "The settings (default: /etc/kytreportingd/kytreportingd.toml)");
  app.add_option("--log-level", level, "What is logged")
      ->check(CLI::IsMember({"debug", "default", "error"}))
      ->capture_default_str();
  CLI11_PARSE(app, argc, argv);
  options.logLevel = level == "debug"   ? kyt::LogLevel::debug
                     : level == "error" ? kyt::LogLevel::error
                                        : kyt::LogLevel::normal;
  return kyt::runDaemon(options);
}
