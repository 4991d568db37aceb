#include "platform/linux/system/TomlBundle.h"

#include <dirent.h>

#include "platform/linux/system/Files.h"
#include "platform/linux/system/Toml.h"

namespace kyt {

TomlBundle::TomlBundle(const std::string& folder, Log& log) {
  const std::string info = folder + "/info.toml";
  auto parsed = readToml(info);
  if (const auto* error = std::get_if<TomlError>(&parsed)) {
    log.error("bundle: %s", error->text.c_str());
  } else {
    const auto& table = std::get<TomlTable>(parsed);
    const auto version = table.find("version");
    if (version != table.end() && version->second.text() != nullptr) {
      version_ = String(std::string_view(*version->second.text()));
    } else {
      log.error("bundle: %s: \"version\" must be text", info.c_str());
    }
  }
  DIR* entries = ::opendir(folder.c_str());
  if (entries == nullptr) return;
  while (const dirent* entry = ::readdir(entries)) {
    const std::string name = entry->d_name;
    if (name.starts_with('.') || name == "info.toml") continue;
    auto contents = readRegularFile(folder + "/" + name, kMaxResourceBytes);
    if (const auto* wrong = std::get_if<std::string>(&contents)) {
      log.error("bundle: %s/%s: %s", folder.c_str(), name.c_str(), wrong->c_str());
    } else {
      resources_.emplace(name, Data(std::string_view(std::get<FileContents>(contents).bytes)));
    }
  }
  ::closedir(entries);
}

std::optional<Data> TomlBundle::resource(std::string_view name, std::string_view type) {
  std::string file(name);
  if (!type.empty()) file.append(".").append(type);
  const auto found = resources_.find(file);
  if (found == resources_.end()) return std::nullopt;
  return found->second;
}

}  // namespace kyt
