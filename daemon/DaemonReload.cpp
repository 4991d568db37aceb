#include "daemon/DaemonReload.h"

#include <utility>
#include <variant>

#include "platform/linux/files/Files.h"
#include "platform/linux/toml/TomlSettings.h"

namespace kyt {

// The confinement names the folder of the certificates, once; another one is out of reach.
bool DaemonReload::mustWait(const std::string& setting, const Settings& read) const {
  if (setting != "tls.ca_file" || read.caFile.empty()) return false;
  const auto seen = readRegularFile(read.caFile, kMaxTomlBytes);
  const auto* problem = std::get_if<ReadProblem>(&seen);
  return problem != nullptr && problem->error != 0;
}

DaemonReload::Outcome DaemonReload::reload() {
  const MutexLock lock(mutex_);
  Outcome outcome;
  std::vector<std::string>& lines = outcome.lines;
  const auto read = readSettings(parts_.file);
  if (const auto* error = std::get_if<TomlError>(&read)) {
    outcome.problem = error->text + ": nothing is taken up";
    parts_.log.error("reload: %s", outcome.problem->c_str());
    return outcome;
  }
  const Settings& settings = std::get<Settings>(read);
  bool takesUp = false;
  for (const SettingChange& change : changedSettings(parts_.running, settings)) {
    const bool isFixed = change.name == "log.level" && parts_.commandLine.has_value();
    const bool waits = change.taking == Taking::atStart || mustWait(change.name, settings);
    lines.push_back(change.name + (isFixed ? ": the command line's counts"
                                   : waits ? ": counts after a restart"
                                           : ": taken up"));
    if (isFixed || waits) continue;
    change.take(parts_.running, settings);
    takesUp = true;
  }
  if (takesUp) {
    if (!parts_.commandLine) parts_.log.setLevel(parts_.running.logLevel);
    parts_.takeUp(parts_.running);
  }
  if (lines.empty()) lines.emplace_back("no setting has changed");
  for (const std::string& line : lines) parts_.log.normal("reload: %s", line.c_str());
  return outcome;
}

}  // namespace kyt
