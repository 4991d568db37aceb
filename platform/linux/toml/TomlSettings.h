// kytreportingd.toml. Everything is checked: an unknown section or key, a wrong type or a number out of range
// is an error with file and line, since a setting that is silently ignored is found out too late. So is a file that
// others than root and this process's user can write: it says where events go, and whom to trust.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "platform/base/Settings.h"
#include "platform/linux/toml/Toml.h"

namespace kyt {

[[nodiscard]] std::variant<Settings, TomlError> readSettings(const std::string& path);
[[nodiscard]] std::variant<Settings, TomlError> parseSettings(std::string_view text, std::string_view name);
// Everything that is wrong with the file, in the order of its lines; empty: nothing.
[[nodiscard]] std::vector<TomlError> problemsOfSettings(const std::string& path);

// When a changed setting counts: taken up by a daemon that runs, or at its next start alone.
enum class Taking : uint8_t { whileRunning, atStart };

// One that two readings have differently.
struct SettingChange {
  std::string name;  // "section.key"
  Taking taking;
  void (*take)(Settings& to, const Settings& from);
};
// In the order of settingNames().
[[nodiscard]] std::vector<SettingChange> changedSettings(const Settings& running, const Settings& read);

// All keys that there are, as "section.key": what documentation is compared with.
[[nodiscard]] std::vector<std::string> settingNames();

}  // namespace kyt
