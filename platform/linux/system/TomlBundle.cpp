#include "platform/linux/system/TomlBundle.h"

#include <dirent.h>

#include <cerrno>
#include <utility>

#include "platform/TextEscape.h"
#include "platform/linux/system/Toml.h"

namespace kyt {

TomlBundle::TomlBundle(const std::string& folder, Log& log) : folder_(folder), log_(log) {
  MutexLock lock(mutex_);
  readAgain();
}

bool TomlBundle::failed(const std::string& path, const ReadProblem& problem) {
  log_.error("bundle: %s: %s", escapedText(path).c_str(), problem.text.c_str());
  return isMomentary(problem.error);
}

void TomlBundle::readAgain() {
  if (versionUnread_) readVersion();
  if (resourcesUnread_) readResources();
}

void TomlBundle::readVersion() {
  versionUnread_ = false;
  const std::string info = folder_ + "/info.toml";
  auto contents = readRegularFile(info, kMaxTomlBytes);
  if (const auto* wrong = std::get_if<ReadProblem>(&contents)) {
    versionUnread_ = failed(info, *wrong);
    return;
  }
  auto parsed = parseToml(std::get<FileContents>(contents).bytes, info);
  if (const auto* error = std::get_if<TomlError>(&parsed)) {
    log_.error("bundle: %s", error->text.c_str());
    return;
  }
  const auto& table = std::get<TomlTable>(parsed);
  const auto version = table.find("version");
  if (version != table.end() && version->second.text() != nullptr) {
    version_ = String(std::string_view(*version->second.text()));
  } else {
    log_.error("bundle: %s: \"version\" must be text", info.c_str());
  }
}

void TomlBundle::readResources() {
  resourcesUnread_ = false;
  DIR* entries = ::opendir(folder_.c_str());
  if (entries == nullptr) {
    resourcesUnread_ = failed(folder_, {errorText(errno), errno});
    return;
  }
  const dirent* entry = nullptr;
  while (errno = 0, (entry = ::readdir(entries)) != nullptr) {
    const std::string name = entry->d_name;
    if (name.starts_with('.') || name == "info.toml" || resources_.contains(name)) continue;
    const std::string path = folder_ + "/" + name;
    auto contents = readRegularFile(path, kMaxResourceBytes);
    if (const auto* wrong = std::get_if<ReadProblem>(&contents)) {
      resourcesUnread_ |= failed(path, *wrong);
    } else {
      resources_.emplace(name, Data(std::string_view(std::get<FileContents>(contents).bytes)));
    }
  }
  if (errno != 0) resourcesUnread_ |= failed(folder_, {errorText(errno), errno});
  ::closedir(entries);
}

std::optional<String> TomlBundle::version() {
  MutexLock lock(mutex_);
  readAgain();
  return version_;
}

std::optional<Data> TomlBundle::resource(std::string_view name, std::string_view type) {
  std::string file(name);
  if (!type.empty()) file.append(".").append(type);
  MutexLock lock(mutex_);
  if (!resources_.contains(file)) readAgain();
  const auto found = resources_.find(file);
  if (found == resources_.end()) return std::nullopt;
  return found->second;
}

}  // namespace kyt
