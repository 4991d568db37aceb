#include "platform/linux/toml/TomlBundle.h"

#include <cerrno>
#include <variant>

#include "platform/base/TextEscape.h"
#include "platform/linux/toml/Toml.h"

namespace kyt {

TomlBundle::TomlBundle(const std::string& folder, Log& log) : folder_(folder), log_(log) {
  MutexLock lock(mutex_);
  readVersion();
}

bool TomlBundle::failed(const std::string& path, const ReadProblem& problem) {
  log_.error("bundle: %s: %s", escapedText(path).c_str(), problem.text.c_str());
  return isMomentary(problem.error);
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

std::optional<String> TomlBundle::version() {
  MutexLock lock(mutex_);
  if (versionUnread_) readVersion();
  return version_;
}

std::optional<Data> TomlBundle::resource(std::string_view name, std::string_view type) {
  std::string file(name);
  if (!type.empty()) file.append(".").append(type);
  if (file.find('/') != file.npos) return std::nullopt;
  const std::string path = folder_ + "/" + file;
  const auto contents = readRegularFile(path, kMaxResourceBytes);
  if (const auto* read = std::get_if<FileContents>(&contents)) return Data(std::string_view(read->bytes));
  const auto& wrong = std::get<ReadProblem>(contents);
  // What is not there is no fault of the bundle's; one that momentarily cannot be read is read at the next question.
  if (wrong.error != ENOENT) static_cast<void>(failed(path, wrong));
  return std::nullopt;
}

}  // namespace kyt
