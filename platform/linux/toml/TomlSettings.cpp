#include "platform/linux/toml/TomlSettings.h"

#include <sys/stat.h>
#include <unistd.h>

#include <limits>
#include <utility>

#include "platform/linux/files/Files.h"

namespace kyt {
namespace {

// A setter returns what is wrong with the value, or null. The line and the key are added by the caller.
using Setter = const char* (*)(const TomlNode& node, Settings& settings);

template <uint64_t Limits::*field, uint64_t most = uint64_t{std::numeric_limits<int64_t>::max()}>
const char* setCount(const TomlNode& node, Settings& settings) {
  const auto* number = std::get_if<int64_t>(&node.value);
  if (number == nullptr || *number < 1) return "must be a whole number of at least 1";
  if (static_cast<uint64_t>(*number) > most) return "is too large";
  settings.limits.*field = static_cast<uint64_t>(*number);
  return nullptr;
}

template <std::optional<uint64_t> Limits::*field>
const char* setShare(const TomlNode& node, Settings& settings) {
  const std::string* text = node.text();
  if (text != nullptr && *text == "auto") {
    settings.limits.*field = std::nullopt;
    return nullptr;
  }
  const auto* number = std::get_if<int64_t>(&node.value);
  if (number == nullptr || *number < 1) return "must be \"auto\" or a whole number of at least 1";
  settings.limits.*field = static_cast<uint64_t>(*number);
  return nullptr;
}

template <double Limits::*field>
const char* setSeconds(const TomlNode& node, Settings& settings) {
  constexpr double kMost = 365.0 * 86400;
  double seconds = -1;
  if (const auto* whole = std::get_if<int64_t>(&node.value)) seconds = static_cast<double>(*whole);
  if (const auto* real = std::get_if<double>(&node.value)) seconds = *real;
  if (!(seconds >= 0 && seconds <= kMost)) return "must be a number of seconds, from 0 to a year";
  settings.limits.*field = seconds;
  return nullptr;
}

template <std::string Settings::*field>
const char* setHost(const TomlNode& node, Settings& settings) {
  const std::string* text = node.text();
  if (text == nullptr) return "must be text";
  std::string_view address = *text;
  while (!address.empty() && address.back() == '/') address.remove_suffix(1);
  size_t scheme = 0;
  if (address.starts_with("https://")) scheme = 8;
  if (address.starts_with("http://")) scheme = 7;
  if (scheme == 0 || address.size() == scheme || address[scheme] == '/') {
    return "must be an address like \"https://bags.example.org\"";
  }
  for (char c : address) {
    if (c <= 0x20 || c == 0x7F) return "must hold no blank and no control character";
  }
  settings.*field = address;
  return nullptr;
}

const char* setCAFile(const TomlNode& node, Settings& settings) {
  const std::string* text = node.text();
  if (text == nullptr || !text->starts_with('/') || text->find('\0') != std::string::npos) {
    return "must be the absolute path of a file";
  }
  settings.caFile = *text;
  return nullptr;
}

const char* setCellularInterfaces(const TomlNode& node, Settings& settings) {
  const TomlArray* array = node.array();
  if (array == nullptr) return "must be an array of texts";
  for (const TomlNode& entry : *array) {
    if (entry.text() == nullptr || entry.text()->empty())
      return "must be an array of texts, none of them empty";
    settings.cellularInterfaces.push_back(*entry.text());
  }
  return nullptr;
}

const char* setLogTarget(const TomlNode& node, Settings& settings) {
  const std::string* text = node.text();
  if (text != nullptr && *text == "auto") {
    settings.logTarget = LogTarget::automatic;
  } else if (text != nullptr && *text == "journal") {
    settings.logTarget = LogTarget::journal;
  } else if (text != nullptr && *text == "stderr") {
    settings.logTarget = LogTarget::standardError;
  } else {
    return "must be \"auto\", \"journal\" or \"stderr\"";
  }
  return nullptr;
}

const char* setCompressionLibrary(const TomlNode& node, Settings& settings) {
  const std::string* text = node.text();
  if (text != nullptr && *text == "zlib") {
    settings.compression.library = CompressionLibrary::zlib;
  } else if (text != nullptr && *text == "libdeflate") {
    settings.compression.library = CompressionLibrary::libdeflate;
  } else {
    return "must be \"zlib\" or \"libdeflate\"";
  }
  return nullptr;
}

const char* setCompressionLevel(const TomlNode& node, Settings& settings) {
  const auto* number = std::get_if<int64_t>(&node.value);
  if (number == nullptr || *number < 1 || *number > 9) return "must be a whole number from 1 to 9";
  settings.compression.level = static_cast<int>(*number);
  return nullptr;
}

struct Setting {
  std::string_view section, key;
  Setter set;
};

constexpr uint64_t kLargestMessage = 134217728;  // the wire protocol's own limit

constexpr Setting kSettings[] = {
    {"storebag", "internal_host", setHost<&Settings::storebagInternalHost>},
    {"storebag", "public_host", setHost<&Settings::storebagPublicHost>},
    {"tls", "ca_file", setCAFile},
    {"network", "cellular_interfaces", setCellularInterfaces},
    {"limits", "max_message_bytes", setCount<&Limits::maxMessageBytes, kLargestMessage>},
    {"limits", "max_queued_bytes", setCount<&Limits::maxQueuedBytes>},
    {"limits", "max_connections", setCount<&Limits::maxConnections>},
    {"limits", "max_connections_per_user", setCount<&Limits::maxConnectionsPerUser>},
    {"limits", "max_bytes_per_user", setShare<&Limits::maxBytesPerUser>},
    {"limits", "max_descriptors_per_user", setShare<&Limits::maxDescriptorsPerUser>},
    {"limits", "max_uploading_bytes_per_user", setShare<&Limits::maxUploadingBytesPerUser>},
    {"limits", "max_upload_bytes", setCount<&Limits::maxUploadBytes>},
    {"limits", "max_batch_bytes", setCount<&Limits::maxBatchBytes>},
    {"limits", "max_hierarchy_tokens_per_user", setCount<&Limits::maxHierarchyTokensPerUser>},
    {"limits", "max_shared_data_bytes_per_user", setCount<&Limits::maxSharedDataBytesPerUser>},
    {"limits", "max_custom_identifiers_per_user", setCount<&Limits::maxCustomIdentifiersPerUser>},
    {"service", "idle_exit_seconds", setSeconds<&Limits::idleExitSeconds>},
    {"service", "shutdown_grace_seconds", setSeconds<&Limits::shutdownGraceSeconds>},
    {"log", "target", setLogTarget},
    {"compression", "library", setCompressionLibrary},
    {"compression", "level", setCompressionLevel},
};

bool isSection(std::string_view name) {
  for (const Setting& setting : kSettings) {
    if (setting.section == name) return true;
  }
  return false;
}

const Setting* find(std::string_view section, std::string_view key) {
  for (const Setting& setting : kSettings) {
    if (setting.section == section && setting.key == key) return &setting;
  }
  return nullptr;
}

}  // namespace

std::variant<Settings, TomlError> parseSettings(std::string_view text, std::string_view name) {
  auto parsed = parseToml(text, name);
  if (auto* error = std::get_if<TomlError>(&parsed)) return std::move(*error);
  Settings settings;
  for (const auto& [section, node] : std::get<TomlTable>(parsed)) {
    if (!isSection(section)) return tomlError(name, node.line, "unknown section or key \"" + section + "\"");
    if (node.table() == nullptr) return tomlError(name, node.line, "\"" + section + "\" must be a section");
    for (const auto& [key, value] : *node.table()) {
      const std::string full = section + "." + key;
      const Setting* setting = find(section, key);
      if (setting == nullptr) return tomlError(name, value.line, "unknown key \"" + full + "\"");
      if (const char* wrong = setting->set(value, settings)) {
        return tomlError(name, value.line, "\"" + full + "\" " + wrong);
      }
    }
  }
  if (settings.storebagInternalHost.empty())
    return tomlError(name, 0, "\"storebag.internal_host\" is missing");
  if (settings.storebagPublicHost.empty()) return tomlError(name, 0, "\"storebag.public_host\" is missing");
  return settings;
}

std::vector<std::string> settingNames() {
  std::vector<std::string> names;
  for (const Setting& setting : kSettings)
    names.push_back(std::string(setting.section) + "." + std::string(setting.key));
  return names;
}

std::variant<Settings, TomlError> readSettings(const std::string& path) {
  auto contents = readRegularFile(path, kMaxTomlBytes);
  if (const auto* wrong = std::get_if<ReadProblem>(&contents)) return tomlError(path, 0, wrong->text);
  const auto& file = std::get<FileContents>(contents);
  const bool trustedOwner = file.identity.owner == 0 || file.identity.owner == ::geteuid();
  if (!trustedOwner || (file.identity.mode & (S_IWGRP | S_IWOTH)) != 0)
    return tomlError(path, 0, "others than root and the daemon's user can write the file");
  return parseSettings(file.bytes, path);
}

}  // namespace kyt
