#include "daemon/DaemonConfigurationCheck.h"

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <span>
#include <utility>
#include <variant>

#include "config/Environment.h"
#include "platform/UserDefaults.h"
#include "platform/base/NearestName.h"
#include "platform/base/Paths.h"
#include "platform/base/TextEscape.h"
#include "platform/linux/base/Threads.h"
#include "platform/linux/base/UnixSocket.h"
#include "platform/linux/confinement/ConfinementProfile.h"
#include "platform/linux/data/OpenSSLCryptography.h"
#include "platform/linux/device/LinuxDeviceProperties.h"
#include "platform/linux/entitlements/EntitlementsFile.h"
#include "platform/linux/files/Files.h"
#include "platform/linux/service/Process.h"
#include "platform/linux/toml/FlatToml.h"
#include "platform/linux/toml/TomlBundle.h"
#include "platform/linux/toml/TomlSettings.h"
#include "platform/linux/url/CertificateStore.h"
#include "platform/objects/Keys.h"

namespace kyt {

namespace {

using Problems = std::vector<std::string>;

// What the package puts among the grants; no mistake of anybody's.
constexpr const char kGuideToGrants[] = "README";

void checkSettings(const std::string& path, Problems& problems) {
  for (const TomlError& problem : problemsOfSettings(path)) problems.push_back(problem.text);
  const auto read = readSettings(path);
  const auto* settings = std::get_if<Settings>(&read);
  if (settings == nullptr || settings->caFile.empty()) return;
  if (CertificateStore(settings->caFile).store() == nullptr)
    problems.push_back(settings->caFile + ": holds no certificates that can be read (tls.ca_file)");
}

void checkEntitlements(const std::string& folder, bool isPrivateRoot, Problems& problems) {
  std::optional<uint32_t> trusted;
  if (isPrivateRoot) trusted = currentUser();
  const EntitlementsListing listing = entitlementsFiles(folder);
  if (listing.error != 0 && listing.error != ENOENT)
    problems.push_back(folder + ": " + errorText(listing.error));
  for (const std::string& name : listing.names) {
    const EntitlementsFile file = readEntitlementsFile(folder + "/" + name, trusted);
    for (const TomlError& problem : file.problems) problems.push_back(problem.text);
  }
}

// Files beside the grants. They are no mistake: an editor leaves some behind, and a package manager.
Problems remarksOnEntitlements(const std::string& folder) {
  Problems remarks;
  for (const std::string& name : entitlementsFiles(folder).others)
    if (name != kGuideToGrants)
      remarks.push_back(folder + "/" + name +
                        ": is not read: its name must end in .toml and not begin with a point");
  return remarks;
}

// A flat file that may be missing; none when it is, or is wrong.
std::optional<FlatToml> readFlat(const std::string& path, Problems& problems) {
  const auto contents = readRegularFile(path, kMaxTomlBytes);
  if (const auto* problem = std::get_if<ReadProblem>(&contents)) {
    if (problem->error != ENOENT) problems.push_back(path + ": " + problem->text);
    return std::nullopt;
  }
  auto parsed = parseFlatToml(std::get<FileContents>(contents).bytes, path);
  if (const auto* error = std::get_if<TomlError>(&parsed)) {
    problems.push_back(error->text);
    return std::nullopt;
  }
  return std::get<FlatToml>(std::move(parsed));
}

void checkDevice(const std::string& path, Problems& problems) {
  const std::optional<FlatToml> file = readFlat(path, problems);
  if (!file) return;
  const std::vector<std::string> known = devicePropertyKeys();
  for (const auto& [key, entry] : file->entries) {
    if (std::find(known.begin(), known.end(), key) != known.end()) {
      if (!entry.value.isString())
        problems.push_back(tomlError(path, entry.line, "\"" + key + "\" must be text").text);
      continue;
    }
    const auto nearest = nearestName(key, known);
    problems.push_back(tomlError(path, entry.line,
                                 "unknown key \"" + key + "\"" +
                                     (nearest ? "; the nearest known one is \"" + *nearest + "\"" : ""))
                           .text);
  }
}

void checkUserDefaults(const std::string& folder, Problems& problems) {
  const auto fileOf = [&folder](const char* domain) { return folder + "/" + domain + ".toml"; };
  const std::string consentPath = fileOf(kDiagnosticsDefaultsDomain);
  if (const auto consent = readFlat(consentPath, problems)) {
    const auto entry = consent->entries.find("consent");
    if (entry != consent->entries.end() && entry->second.value.kind() != Value::Kind::boolean)
      problems.push_back(
          tomlError(consentPath, entry->second.line, "\"consent\" must be true or false").text);
  }
  const std::string ownPath = fileOf(kKYTReportingDefaultsDomain);
  if (const auto own = readFlat(ownPath, problems)) {
    const auto entry = own->entries.find("environmentType");
    const bool isThere = entry != own->entries.end();
    if (isThere && (!entry->second.value.isNumber() || entry->second.value.intValue() < 0 ||
                    entry->second.value.unsignedIntValue() > kEnvironmentRelease))
      problems.push_back(
          tomlError(ownPath, entry->second.line, "\"environmentType\" must be a number from 0 to 4").text);
  }
  static_cast<void>(readFlat(fileOf(kTimedDefaultsDomain), problems));
}

void checkPublicKeys(const Paths& paths, Problems& problems) {
  OpenSSLCryptography cryptography;
  for (const char* name : {"publicKey", "publicKey2"}) {
    const std::string path = paths.clientBundle() + "/" + name + ".der";
    const auto contents = readRegularFile(path, TomlBundle::kMaxResourceBytes);
    if (const auto* problem = std::get_if<ReadProblem>(&contents)) {
      const bool mayBeMissing = problem->error == ENOENT && std::string_view(name) == "publicKey2";
      if (!mayBeMissing) problems.push_back(path + ": " + problem->text);
      continue;
    }
    const std::string& der = std::get<FileContents>(contents).bytes;
    if (cryptography.publicKeyFromDER(std::as_bytes(std::span(der))) == nullptr)
      problems.push_back(path + ": is no RSA public key in DER");
  }
}

void checkProfile(const Paths& paths, Problems& problems) {
  const std::string path = paths.kytShare() + "/" + kServiceName + ".profile";
  const auto text = readTomlText(path);
  if (const auto* error = std::get_if<TomlError>(&text)) return problems.push_back(error->text);
  const ProfileVariables variables = {{"CONFIG", "/"},  {"SETTINGS", "/"}, {"SHARE", "/"},
                                      {"PLUGINS", "/"}, {"STATE", "/"},    {"OUTBOX", "/"},
                                      {"LOGS", "/"},    {"RUN", "/"},      {"CA", "/"}};
  const auto profile = parseProfile(std::get<std::string>(text), path, variables);
  if (const auto* error = std::get_if<TomlError>(&profile)) problems.push_back(error->text);
}

}  // namespace

std::vector<std::string> configurationProblems(const DaemonOptions& options) {
  const Paths paths = Paths::of(absolutePath(options.root), executableFolder());
  Problems problems;
  checkSettings(options.config.empty() ? paths.settings() : absolutePath(options.config), problems);
  checkEntitlements(paths.entitlements(), !paths.root.empty(), problems);
  checkDevice(paths.device(), problems);
  checkUserDefaults(paths.userDefaults(), problems);
  checkPublicKeys(paths, problems);
  checkProfile(paths, problems);
  return problems;
}

int checkConfiguration(const DaemonOptions& options) {
  const std::vector<std::string> problems = configurationProblems(options);
  const Paths paths = Paths::of(absolutePath(options.root), executableFolder());
  for (const auto& lines : {problems, remarksOnEntitlements(paths.entitlements())})
    for (const std::string& line : lines) std::printf("%s\n", escapedText(line).c_str());
  if (problems.empty()) std::printf("the configuration is good\n");
  return problems.empty() ? 0 : 1;
}

}  // namespace kyt
