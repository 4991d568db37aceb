// The receiver's settings. What is checked besides memory: each error is a plain line that begins with the file's name, and
// what was accepted keeps its rules.
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "platform/base/TextEscape.h"
#include "receiver/Limits.h"
#include "receiver/Settings.h"

namespace {

using namespace kyt::receiver;

void require(bool condition) {
  if (!condition) std::abort();
}

void check(const Settings& settings) {
  require(settings.certificateFile.empty() == settings.keyFile.empty());
  require(!settings.log.servers.empty() && !settings.log.stream.empty());
  require(settings.log.partitions >= 1 && settings.log.partitions <= Limits::maxPartitions);
  require(settings.log.replicas >= 1 && settings.log.replicas <= 5);
  require(settings.log.publishTime.count() >= 50 && settings.log.publishTime.count() <= 30'000);
  require(!settings.spoolPath.empty() && !settings.paths.empty());
  for (const PathSettings& path : settings.paths) {
    require(path.urlPath.starts_with('/'));
    require(path.digest != DigestPolicy::required || !path.digestKeys.empty());
    for (const auto& [name, keys] : path.digestKeys) {
      require(name.find('/') != std::string::npos && !keys.empty());
      for (const std::string& key : keys) require(!key.empty());
    }
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const auto result = parseSettings({reinterpret_cast<const char*>(data), size}, "f.toml");
  if (const auto* settings = std::get_if<Settings>(&result)) {
    check(*settings);
    return 0;
  }
  const auto& lines = std::get<SettingsErrors>(result).lines;
  require(!lines.empty());
  for (const std::string& line : lines) require(line.starts_with("f.toml") && kyt::isPlainText(line));
  return 0;
}
