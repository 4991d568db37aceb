// The four kinds of TOML files: settings, flat files (user defaults, device.toml), entitlements and
// confinement profiles. The first byte chooses. What is checked besides memory: errors are one plain line
// that begins with the file's name, a flat file's key can be replaced without touching the others, and what
// was accepted keeps its rules.
#include <cstdint>
#include <cstdlib>
#include <string>
#include <string_view>

#include "platform/base/TextEscape.h"
#include "platform/linux/confinement/ConfinementProfile.h"
#include "platform/linux/entitlements/TomlEntitlements.h"
#include "platform/linux/toml/FlatToml.h"
#include "platform/linux/toml/TomlSettings.h"

namespace kyt {
namespace {

void require(bool condition) {
  if (!condition) std::abort();
}

void check(const TomlError& error) {
  require(error.text.starts_with("f.toml"));
  require(isPlainText(error.text));
}

void settings(std::string_view text) {
  const auto result = parseSettings(text, "f.toml");
  if (const auto* error = std::get_if<TomlError>(&result)) return check(*error);
  const auto& settings = std::get<Settings>(result);
  require(!settings.storebagInternalHost.empty() && !settings.storebagPublicHost.ends_with('/'));
  require(settings.compression.level >= 1 && settings.compression.level <= 9);
  require(settings.limits.maxMessageBytes >= 1 && settings.limits.idleExitSeconds >= 0);
}

void flat(std::string_view text) {
  const auto result = parseFlatToml(text, "f.toml");
  if (const auto* error = std::get_if<TomlError>(&result)) return check(*error);
  const auto& file = std::get<FlatToml>(result);
  std::string key = "uuid:a:b";
  if (!file.entries.empty()) key = file.entries.begin()->first;
  const auto changed = file.textWith(key, Value("new \"value\"\n"));
  if (!changed) return;  // an empty key, or a place that cannot be told from its neighbours
  const auto again = parseFlatToml(*changed, "f.toml");
  require(std::holds_alternative<FlatToml>(again));
  const auto& after = std::get<FlatToml>(again);
  require(after.value(key) == Value("new \"value\"\n"));
  for (const auto& [other, entry] : file.entries) {
    if (other == key) continue;
    const Value kept = after.value(other);
    const auto real = entry.value.real();
    require(kept == entry.value || (real && *real != *real));  // what is no number equals nothing
  }
}

void entitlements(std::string_view text) {
  const auto result = parseEntitlements(text, "f.toml");
  if (const auto* error = std::get_if<TomlError>(&result)) return check(*error);
  for (const auto& problem : std::get<EntitlementGrants>(result).problems) check(problem);
  for (const auto& grant : std::get<EntitlementGrants>(result).grants) {
    require(grant.user || grant.group || grant.executable || grant.securityLabel);
  }
}

void profile(std::string_view text) {
  const auto result = parseProfile(text, "f.toml", {{"STATE", "/state"}, {"CA", ""}});
  if (const auto* error = std::get_if<TomlError>(&result)) return check(*error);
  for (const std::string& path : std::get<ConfinementProfile>(result).write) require(path.starts_with('/'));
}

}  // namespace
}  // namespace kyt

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size == 0) return 0;
  const std::string_view text(reinterpret_cast<const char*>(data) + 1, size - 1);
  switch (data[0] & 3) {
    case 0:
      kyt::settings(text);
      break;
    case 1:
      kyt::flat(text);
      break;
    case 2:
      kyt::entitlements(text);
      break;
    default:
      kyt::profile(text);
      break;
  }
  return 0;
}
