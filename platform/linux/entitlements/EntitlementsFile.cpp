#include "platform/linux/entitlements/EntitlementsFile.h"

#include <dirent.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <utility>

#include "platform/base/NearestName.h"

namespace kyt {
namespace {

constexpr const char* kUnknown = "is unknown";

std::optional<NameOrNumber> nameOrNumber(const TomlNode& node) {
  if (const auto* text = node.text(); text != nullptr && !text->empty()) return NameOrNumber(*text);
  if (const auto* number = std::get_if<int64_t>(&node.value); number != nullptr && *number >= 0)
    return NameOrNumber(*number);
  return std::nullopt;
}

// What is wrong with the entry, or null.
const char* readEntry(const std::string& key, const TomlNode& node, EntitlementGrant& grant) {
  if (key == "user" || key == "group") {
    auto& criterion = key == "user" ? grant.user : grant.group;
    criterion = nameOrNumber(node);
    return criterion ? nullptr : "must be a name or a number";
  }
  if (key == "executable") {
    if (node.text() == nullptr || !node.text()->starts_with('/')) return "must be an absolute path";
    grant.executable = *node.text();
    return nullptr;
  }
  if (key == "security_label") {
    if (node.text() == nullptr || node.text()->empty()) return "must be text";
    grant.securityLabel = *node.text();
    return nullptr;
  }
  if (node.table() != nullptr) return "must be a value (the name of an entitlement stands in quotes)";
  if (key.find('.') == std::string::npos) return kUnknown;
  auto value = node.scalar();
  if (!value) return "must be text, a boolean or a number";
  grant.values.emplace(key, std::move(*value));
  return nullptr;
}

// "; the nearest known one is …", where there is one.
std::string nearestCriterion(const std::string& key) {
  const std::string known[] = {"user", "group", "executable", "security_label"};
  const auto nearest = nearestName(key, known);
  return nearest ? "; the nearest known one is \"" + *nearest + "\"" : "";
}

void readGrant(const TomlNode& node, std::string_view name, EntitlementGrants& result) {
  if (node.table() == nullptr) {
    result.problems.push_back(tomlError(name, node.line, "a grant must be a table. It is ignored"));
    return;
  }
  EntitlementGrant grant;
  grant.line = node.line;
  for (const auto& [key, entry] : *node.table()) {
    if (const char* wrong = readEntry(key, entry, grant)) {
      result.problems.push_back(tomlError(name, entry.line,
                                          "\"" + key + "\" " + wrong +
                                              (wrong == kUnknown ? nearestCriterion(key) : "") +
                                              ". The grant is ignored"));
      return;
    }
  }
  if (!grant.user && !grant.group && !grant.executable && !grant.securityLabel) {
    result.problems.push_back(
        tomlError(name, node.line, "a grant without user, group, executable and security_label is ignored"));
    return;
  }
  result.grants.push_back(std::move(grant));
}

}  // namespace

std::variant<EntitlementGrants, TomlError> parseEntitlements(std::string_view text, std::string_view name) {
  auto parsed = parseToml(text, name);
  if (auto* error = std::get_if<TomlError>(&parsed)) return std::move(*error);
  EntitlementGrants result;
  for (const auto& [key, node] : std::get<TomlTable>(parsed)) {
    if (key != "grant") return tomlError(name, node.line, "unknown section or key \"" + key + "\"");
    if (node.array() == nullptr) return tomlError(name, node.line, "grants are written as [[grant]]");
    for (const TomlNode& grant : *node.array()) readGrant(grant, name, result);
  }
  return result;
}

namespace {

bool isLinkOfOthers(const struct stat& status, std::optional<uint32_t> trustedUser) {
  return S_ISLNK(status.st_mode) && status.st_uid != 0 && status.st_uid != trustedUser;
}

EntitlementsFile unreadable(const std::string& path, const ReadProblem& problem) {
  EntitlementsFile result;
  result.path = path;
  result.identity = identityOf(path);
  result.unreadable = result.ignored = true;
  result.error = problem.error;
  result.problems.push_back(tomlError(path, 0, problem.text + ". The file is ignored"));
  return result;
}

}  // namespace

EntitlementsFile readEntitlementsFile(const std::string& path, std::optional<uint32_t> trustedUser) {
  // In a folder that others can write they could otherwise link a grant of root's that is not meant to count.
  struct stat link = {};
  if (::lstat(path.c_str(), &link) != 0) return unreadable(path, {errorText(errno), errno});
  auto contents = readRegularFile(path, kMaxTomlBytes);
  if (const auto* wrong = std::get_if<ReadProblem>(&contents)) return unreadable(path, *wrong);
  EntitlementsFile result;
  result.path = path;
  const auto& file = std::get<FileContents>(contents);
  result.identity = file.identity;
  const bool trustedOwner = file.identity.owner == 0 || file.identity.owner == trustedUser;
  if (!trustedOwner || isLinkOfOthers(link, trustedUser) || (file.identity.mode & (S_IWGRP | S_IWOTH)) != 0) {
    result.ignored = true;
    result.problems.push_back(tomlError(path, 0, "others than root can write the file. It is ignored"));
    return result;
  }
  auto parsed = parseEntitlements(file.bytes, path);
  if (const auto* error = std::get_if<TomlError>(&parsed)) {
    result.ignored = true;
    result.problems.push_back(TomlError{error->text + ". The file is ignored"});
    return result;
  }
  auto& grants = std::get<EntitlementGrants>(parsed);
  result.grants = std::move(grants.grants);
  result.problems = std::move(grants.problems);
  return result;
}

EntitlementsListing entitlementsFiles(const std::string& path) {
  EntitlementsListing listing;
  DIR* const folder = ::opendir(path.c_str());
  if (folder == nullptr) {
    listing.error = errno;
    return listing;
  }
  const dirent* entry = nullptr;
  while (errno = 0, (entry = ::readdir(folder)) != nullptr) {
    const std::string_view name = entry->d_name;
    if (name == "." || name == "..") continue;
    (name.ends_with(".toml") && !name.starts_with('.') ? listing.names : listing.others).emplace_back(name);
  }
  listing.error = errno;
  ::closedir(folder);
  if (listing.error != 0) listing.names.clear();
  std::sort(listing.names.begin(), listing.names.end());
  std::sort(listing.others.begin(), listing.others.end());
  return listing;
}

}  // namespace kyt
