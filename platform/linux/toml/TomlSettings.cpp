#include "platform/linux/toml/TomlSettings.h"

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <limits>
#include <utility>

#include "platform/base/NearestName.h"
#include "platform/linux/files/Files.h"

namespace kyt {
namespace {

// A setter returns what is wrong with the value, or null. The line and the key are added by the caller.
using Setter = const char* (*)(const TomlNode& node, Settings& settings);

template <Adjustable<uint64_t> Limits::*field, uint64_t most = uint64_t{std::numeric_limits<int64_t>::max()}>
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

template <auto field>
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

const char* setLogLevel(const TomlNode& node, Settings& settings) {
  const std::string* text = node.text();
  if (text != nullptr && *text == "debug") {
    settings.logLevel = LogLevel::debug;
  } else if (text != nullptr && *text == "default") {
    settings.logLevel = LogLevel::normal;
  } else if (text != nullptr && *text == "error") {
    settings.logLevel = LogLevel::error;
  } else {
    return "must be \"debug\", \"default\" or \"error\"";
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

const char* setAdminGroup(const TomlNode& node, Settings& settings) {
  const std::string* text = node.text();
  if (text == nullptr || text->empty() || text->find('\0') != std::string::npos)
    return "must be the name of a group";
  settings.adminGroup = *text;
  return nullptr;
}

// The member that a setting is, wherever in the settings it stands.
template <auto field, typename Whole>
auto& memberOf(Whole& settings) {
  if constexpr (requires { settings.limits.*field; })
    return settings.limits.*field;
  else if constexpr (requires { settings.compression.*field; })
    return settings.compression.*field;
  else if constexpr (requires { settings.outbox.*field; })
    return settings.outbox.*field;
  else if constexpr (requires { settings.storebagRefusals.*field; })
    return settings.storebagRefusals.*field;
  else
    return settings.*field;
}

template <auto field>
const char* setSwitch(const TomlNode& node, Settings& settings) {
  const auto* on = std::get_if<bool>(&node.value);
  if (on == nullptr) return "must be true or false";
  memberOf<field>(settings) = *on;
  return nullptr;
}

template <uint64_t OutboxSettings::*field, int64_t least, int64_t most>
const char* setOutboxNumber(const TomlNode& node, Settings& settings) {
  const auto* number = std::get_if<int64_t>(&node.value);
  if (number == nullptr || *number < least || *number > most) {
    static const std::string wrong =
        "must be a whole number from " + std::to_string(least) + " to " + std::to_string(most);
    return wrong.c_str();
  }
  settings.outbox.*field = static_cast<uint64_t>(*number);
  return nullptr;
}

struct Setting {
  std::string_view section, key;
  Setter set;
  bool (*isSame)(const Settings& one, const Settings& other);
  void (*take)(Settings& to, const Settings& from);
  Taking taking;
};

template <auto field>
constexpr Setting setting(std::string_view section, std::string_view key, Setter set, Taking taking) {
  return {section,
          key,
          set,
          [](const Settings& one, const Settings& other) {
            return memberOf<field>(one) == memberOf<field>(other);
          },
          [](Settings& to, const Settings& from) { memberOf<field>(to) = memberOf<field>(from); },
          taking};
}

constexpr uint64_t kLargestMessage = 134217728;  // the wire protocol's own limit

constexpr int64_t kLeastOutbox = 65536, kLargestOutbox = int64_t{1} << 40;  // bytes
constexpr int64_t kYear = 31536000;                                         // seconds

constexpr Setting kSettings[] = {
    setting<&Settings::storebagInternalHost>("storebag", "internal_host",
                                             setHost<&Settings::storebagInternalHost>, Taking::atStart),
    setting<&Settings::storebagPublicHost>("storebag", "public_host", setHost<&Settings::storebagPublicHost>,
                                           Taking::atStart),
    setting<&StorebagRefusals::older>("storebag", "refuse_older", setSwitch<&StorebagRefusals::older>,
                                      Taking::atStart),
    setting<&StorebagRefusals::expired>("storebag", "refuse_expired", setSwitch<&StorebagRefusals::expired>,
                                        Taking::atStart),
    setting<&StorebagRefusals::withoutSHA256>("storebag", "require_sha256",
                                              setSwitch<&StorebagRefusals::withoutSHA256>, Taking::atStart),
    setting<&Settings::caFile>("tls", "ca_file", setCAFile, Taking::whileRunning),
    setting<&Settings::cellularInterfaces>("network", "cellular_interfaces", setCellularInterfaces,
                                           Taking::whileRunning),
    setting<&Limits::maxMessageBytes>("limits", "max_message_bytes",
                                      setCount<&Limits::maxMessageBytes, kLargestMessage>,
                                      Taking::whileRunning),
    setting<&Limits::maxQueuedBytes>("limits", "max_queued_bytes", setCount<&Limits::maxQueuedBytes>,
                                     Taking::whileRunning),
    setting<&Limits::maxConnections>("limits", "max_connections", setCount<&Limits::maxConnections>,
                                     Taking::whileRunning),
    setting<&Limits::maxConnectionsPerUser>("limits", "max_connections_per_user",
                                            setCount<&Limits::maxConnectionsPerUser>, Taking::whileRunning),
    setting<&Limits::maxBytesPerUser>("limits", "max_bytes_per_user", setShare<&Limits::maxBytesPerUser>,
                                      Taking::whileRunning),
    setting<&Limits::maxDescriptorsPerUser>("limits", "max_descriptors_per_user",
                                            setShare<&Limits::maxDescriptorsPerUser>, Taking::whileRunning),
    setting<&Limits::maxUploadingBytesPerUser>("limits", "max_uploading_bytes_per_user",
                                               setShare<&Limits::maxUploadingBytesPerUser>,
                                               Taking::whileRunning),
    setting<&Limits::maxUploadBytes>("limits", "max_upload_bytes", setCount<&Limits::maxUploadBytes>,
                                     Taking::whileRunning),
    setting<&Limits::maxBatchBytes>("limits", "max_batch_bytes", setCount<&Limits::maxBatchBytes>,
                                    Taking::whileRunning),
    setting<&Limits::maxHierarchyTokensPerUser>("limits", "max_hierarchy_tokens_per_user",
                                                setCount<&Limits::maxHierarchyTokensPerUser>,
                                                Taking::whileRunning),
    setting<&Limits::maxSharedDataBytesPerUser>("limits", "max_shared_data_bytes_per_user",
                                                setCount<&Limits::maxSharedDataBytesPerUser>,
                                                Taking::whileRunning),
    setting<&Limits::maxCustomIdentifiersPerUser>("limits", "max_custom_identifiers_per_user",
                                                  setCount<&Limits::maxCustomIdentifiersPerUser>,
                                                  Taking::atStart),
    setting<&Limits::idleExitSeconds>("service", "idle_exit_seconds", setSeconds<&Limits::idleExitSeconds>,
                                      Taking::atStart),
    setting<&Limits::shutdownGraceSeconds>("service", "shutdown_grace_seconds",
                                           setSeconds<&Limits::shutdownGraceSeconds>, Taking::whileRunning),
    setting<&Settings::logTarget>("log", "target", setLogTarget, Taking::atStart),
    setting<&Settings::logLevel>("log", "level", setLogLevel, Taking::whileRunning),
    setting<&CompressionSettings::library>("compression", "library", setCompressionLibrary, Taking::atStart),
    setting<&CompressionSettings::level>("compression", "level", setCompressionLevel, Taking::atStart),
    setting<&Settings::adminGroup>("admin", "group", setAdminGroup, Taking::atStart),
    setting<&OutboxSettings::enabled>("outbox", "enabled", setSwitch<&OutboxSettings::enabled>,
                                      Taking::atStart),
    setting<&OutboxSettings::maxBytes>(
        "outbox", "max_bytes", setOutboxNumber<&OutboxSettings::maxBytes, kLeastOutbox, kLargestOutbox>,
        Taking::atStart),
    setting<&OutboxSettings::maxAgeSeconds>("outbox", "max_age_seconds",
                                            setOutboxNumber<&OutboxSettings::maxAgeSeconds, 1, kYear>,
                                            Taking::atStart),
    setting<&OutboxSettings::maxBytesPerUser>(
        "outbox", "max_bytes_per_user",
        setOutboxNumber<&OutboxSettings::maxBytesPerUser, kLeastOutbox, kLargestOutbox>, Taking::atStart),
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

std::vector<std::string> sectionNames() {
  std::vector<std::string> names;
  for (const Setting& setting : kSettings)
    if (names.empty() || names.back() != setting.section) names.emplace_back(setting.section);
  return names;
}

std::string unknown(const char* what, const std::string& name, const std::vector<std::string>& known) {
  const std::optional<std::string> nearest = nearestName(name, known);
  return std::string("unknown ") + what + " \"" + name + "\"" +
         (nearest ? "; the nearest known one is \"" + *nearest + "\"" : "");
}

// What the text says, and all that is wrong with it.
struct ReadSettings {
  void problem(std::string_view name, uint32_t line, std::string_view what) {
    problems.emplace_back(line, tomlError(name, line, what));
  }
  Settings settings;
  std::vector<std::pair<uint32_t, TomlError>> problems;  // with their lines; 0: the whole file's
};

void readSection(ReadSettings& read, const std::string& section, const TomlTable& table,
                 std::string_view name) {
  for (const auto& [key, value] : table) {
    const std::string full = section + "." + key;
    const Setting* setting = find(section, key);
    if (setting == nullptr)
      read.problem(name, value.line, unknown("key", full, settingNames()));
    else if (const char* wrong = setting->set(value, read.settings))
      read.problem(name, value.line, "\"" + full + "\" " + wrong);
  }
}

ReadSettings readAll(std::string_view text, std::string_view name) {
  ReadSettings read;
  auto parsed = parseToml(text, name);
  if (auto* error = std::get_if<TomlError>(&parsed)) {
    read.problems.emplace_back(0, std::move(*error));
    return read;
  }
  for (const auto& [section, node] : std::get<TomlTable>(parsed)) {
    if (!isSection(section))
      read.problem(name, node.line, unknown("section or key", section, sectionNames()));
    else if (node.table() == nullptr)
      read.problem(name, node.line, "\"" + section + "\" must be a section");
    else
      readSection(read, section, *node.table(), name);
  }
  std::stable_sort(read.problems.begin(), read.problems.end(),
                   [](const auto& a, const auto& b) { return a.first < b.first; });
  if (!read.problems.empty()) return read;
  if (read.settings.storebagInternalHost.empty())
    read.problem(name, 0, "\"storebag.internal_host\" is missing");
  if (read.settings.storebagPublicHost.empty()) read.problem(name, 0, "\"storebag.public_host\" is missing");
  return read;
}

std::variant<std::string, TomlError> readTrusted(const std::string& path) {
  auto contents = readRegularFile(path, kMaxTomlBytes);
  if (const auto* wrong = std::get_if<ReadProblem>(&contents)) return tomlError(path, 0, wrong->text);
  auto& file = std::get<FileContents>(contents);
  const bool trustedOwner = file.identity.owner == 0 || file.identity.owner == ::geteuid();
  if (!trustedOwner || (file.identity.mode & (S_IWGRP | S_IWOTH)) != 0)
    return tomlError(path, 0, "others than root and the daemon's user can write the file");
  return std::move(file.bytes);
}

}  // namespace

std::variant<Settings, TomlError> parseSettings(std::string_view text, std::string_view name) {
  ReadSettings read = readAll(text, name);
  if (!read.problems.empty()) return std::move(read.problems.front().second);
  return std::move(read.settings);
}

std::vector<TomlError> problemsOfSettings(const std::string& path) {
  const auto text = readTrusted(path);
  if (const auto* wrong = std::get_if<TomlError>(&text)) return {*wrong};
  std::vector<TomlError> problems;
  for (auto& [line, problem] : readAll(std::get<std::string>(text), path).problems)
    problems.push_back(std::move(problem));
  return problems;
}

std::vector<SettingChange> changedSettings(const Settings& running, const Settings& read) {
  std::vector<SettingChange> changes;
  for (const Setting& setting : kSettings)
    if (!setting.isSame(running, read))
      changes.push_back(
          {std::string(setting.section) + "." + std::string(setting.key), setting.taking, setting.take});
  return changes;
}

std::vector<std::string> settingNames() {
  std::vector<std::string> names;
  for (const Setting& setting : kSettings)
    names.push_back(std::string(setting.section) + "." + std::string(setting.key));
  return names;
}

std::variant<Settings, TomlError> readSettings(const std::string& path) {
  const auto text = readTrusted(path);
  if (const auto* wrong = std::get_if<TomlError>(&text)) return *wrong;
  return parseSettings(std::get<std::string>(text), path);
}

}  // namespace kyt
