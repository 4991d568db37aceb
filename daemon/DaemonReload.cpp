#include "daemon/DaemonReload.h"

#include <utility>
#include <variant>

#include "platform/linux/files/Files.h"
#include "platform/linux/toml/TomlSettings.h"
#include "platform/linux/url/CertificateStore.h"

namespace kyt {

// The confinement names the folder of the certificates, once; another one is out of reach.
std::optional<std::string> DaemonReload::hindrance(const std::string& setting, const Settings& read) const {
  if (setting == "log.level" && parts_.commandLine) return "the command line's counts";
  if (setting != "tls.ca_file" || read.caFile.empty()) return std::nullopt;
  const auto seen = readRegularFile(read.caFile, kMaxTomlBytes);
  if (const auto* problem = std::get_if<ReadProblem>(&seen); problem != nullptr && problem->error != 0)
    return "counts after a restart, the daemon that runs cannot read " + read.caFile + ": " + problem->text;
  if (CertificateStore(read.caFile).store() == nullptr)
    return "not taken up: " + read.caFile + " holds no certificates that can be read";
  return std::nullopt;
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
  bool takesUp = false, takesUpLevel = false;
  for (const SettingChange& change : changedSettings(parts_.running, settings)) {
    const auto hindered = change.taking == Taking::atStart
                              ? std::optional<std::string>("counts after a restart")
                              : hindrance(change.name, settings);
    lines.push_back(change.name + ": " + hindered.value_or("taken up"));
    if (hindered) continue;
    change.take(parts_.running, settings);
    takesUp = true;
    takesUpLevel = takesUpLevel || change.name == "log.level";
  }
  // A level that an administrator has set holds until the file's changes.
  if (takesUpLevel) parts_.log.setLevel(parts_.running.logLevel);
  if (takesUp) parts_.takeUp(parts_.running);
  if (lines.empty()) lines.emplace_back("no setting has changed");
  for (const std::string& line : lines) parts_.log.normal("reload: %s", line.c_str());
  return outcome;
}

}  // namespace kyt
