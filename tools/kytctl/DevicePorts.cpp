#include "tools/kytctl/DevicePorts.h"

#include <cerrno>
#include <utility>
#include <variant>

#include "platform/linux/files/Files.h"
#include "platform/linux/service/Process.h"
#include "platform/linux/toml/Toml.h"
#include "platform/linux/toml/TomlSettings.h"
#include "tools/explain/UnsignedBag.h"

namespace kyt::tools {

namespace {

TomlUserDefaultsOptions userDefaultsIn(const Paths& paths) {
  TomlUserDefaultsOptions options;
  options.folder = paths.userDefaults();
  return options;
}

DeviceSources sourcesIn(const Paths& paths) {
  DeviceSources sources;
  sources.overrides = paths.device();
  return sources;
}

}  // namespace

DevicePorts::DevicePorts(const std::string& root, bool withStorebagServer)
    : paths_(Paths::of(absolutePath(root), executableFolder())),
      userDefaults_(userDefaultsIn(paths_), log_, counters_, clock_),
      deviceProperties_(sourcesIn(paths_), cryptography_, log_, clock_),
      consent_(userDefaults_),
      clientBundle_(paths_.clientBundle(), log_),
      daemonBundle_(paths_.daemonBundle(), log_),
      anySignature_(std::make_unique<AnySignature>(cryptography_)),
      anyKey_(std::make_unique<AnyKeyBundle>(clientBundle_)) {
  auto read = readSettings(paths_.settings());
  if (const auto* error = std::get_if<TomlError>(&read)) {
    if (withStorebagServer) unreadable_.push_back(error->text);
  } else {
    settings_ = std::get<Settings>(std::move(read));
  }
  for (const char* domain : {kKYTReportingDefaultsDomain, kDiagnosticsDefaultsDomain, kTimedDefaultsDomain,
                             kStorebagDefaultsDomain}) {
    noteUnreadable(paths_.userDefaults() + "/" + domain + ".toml");
    static_cast<void>(userDefaults_.values(domain));  // a broken file is told in the log
  }
  noteUnreadable(paths_.device());
  static_cast<void>(deviceProperties_.countryCode());
}

void DevicePorts::noteUnreadable(const std::string& path) {
  const auto contents = readRegularFile(path, kMaxTomlBytes);
  const auto* problem = std::get_if<ReadProblem>(&contents);
  if (problem != nullptr && problem->error != ENOENT) unreadable_.push_back(path + ": " + problem->text);
}

std::vector<std::string> DevicePorts::unreadable() const {
  std::vector<std::string> all = unreadable_;
  for (const MemoryLogSink::Line& line : sink_.lines()) all.push_back(line.line);
  return all;
}

RehearsedDevice DevicePorts::device(bool verified) {
  RehearsedDevice device{
      .userDefaults = userDefaults_,
      .deviceProperties = deviceProperties_,
      .consent = consent_,
      .cryptography = verified ? static_cast<Cryptography&>(cryptography_) : *anySignature_,
      .propertyLists = propertyLists_,
      .json = json_,
      .deflate = deflate_,
      .memory = memory_,
      .clientBundle = verified ? static_cast<Bundle&>(clientBundle_) : *anyKey_,
      .daemonBundle = daemonBundle_,
      .hosts = {},
      .limits = {},
      .refusals = {},
      .now = clock_.timeOfDay()};
  if (settings_) {
    device.hosts = {settings_->storebagInternalHost, settings_->storebagPublicHost};
    device.limits = settings_->limits;
    if (verified) device.refusals = settings_->storebagRefusals;  // a draft has no serial yet
  }
  return device;
}

}  // namespace kyt::tools
