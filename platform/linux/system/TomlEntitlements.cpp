#include "platform/linux/system/TomlEntitlements.h"

#include <dirent.h>
#include <grp.h>
#include <poll.h>
#include <pwd.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <memory>

namespace kyt {
namespace {

using NameOrNumber = std::variant<std::string, int64_t>;

std::optional<NameOrNumber> nameOrNumber(const TomlNode& node) {
  if (const auto* text = node.text(); text != nullptr && !text->empty()) return NameOrNumber(*text);
  if (const auto* number = std::get_if<int64_t>(&node.value); number != nullptr && *number >= 0)
    return NameOrNumber(*number);
  return std::nullopt;
}

std::optional<Value> grantedValue(const TomlNode& node) {
  if (const auto* text = node.text()) return Value(std::string_view(*text));
  if (const auto* boolean = std::get_if<bool>(&node.value)) return Value(*boolean);
  if (const auto* integer = std::get_if<int64_t>(&node.value)) return Value(static_cast<long>(*integer));
  if (const auto* real = std::get_if<double>(&node.value)) return Value(*real);
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
  if (key.find('.') == std::string::npos) return "is unknown";
  auto value = grantedValue(node);
  if (!value) return "must be text, a boolean or a number";
  grant.values.emplace(key, std::move(*value));
  return nullptr;
}

void readGrant(const TomlNode& node, std::string_view name, EntitlementGrants& result) {
  if (node.table() == nullptr) {
    result.problems.push_back(tomlError(name, node.line, "a grant must be a table. It is ignored"));
    return;
  }
  EntitlementGrant grant;
  for (const auto& [key, entry] : *node.table()) {
    if (const char* wrong = readEntry(key, entry, grant)) {
      result.problems.push_back(
          tomlError(name, entry.line, "\"" + key + "\" " + wrong + ". The grant is ignored"));
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

// Names are looked up for every connection: a user may be made after the file was written.
template <typename Entry, typename Lookup>
std::optional<uint32_t> numberOf(const NameOrNumber& who, Lookup lookup, uint32_t Entry::*number) {
  if (const auto* known = std::get_if<int64_t>(&who)) {
    if (*known > int64_t{UINT32_MAX}) return std::nullopt;
    return static_cast<uint32_t>(*known);
  }
  const std::string& name = std::get<std::string>(who);
  for (size_t size = 4096; size <= 1u << 20; size *= 4) {
    const auto buffer = std::make_unique<char[]>(size);
    Entry entry = {};
    Entry* found = nullptr;
    const int error = lookup(name.c_str(), &entry, buffer.get(), size, &found);
    if (error == ERANGE) continue;
    if (error != 0 || found == nullptr) return std::nullopt;
    return found->*number;
  }
  return std::nullopt;
}

bool isUser(const NameOrNumber& who, const PeerCredentials& peer) {
  return numberOf<passwd>(who, ::getpwnam_r, &passwd::pw_uid) == peer.uid;
}

bool isMember(const NameOrNumber& who, const PeerCredentials& peer) {
  const auto group = numberOf<struct group>(who, ::getgrnam_r, &group::gr_gid);
  return group && (*group == peer.gid ||
                   std::find(peer.groups.begin(), peer.groups.end(), *group) != peer.groups.end());
}

// Whether the process that the descriptor stands for has not ended yet.
bool isAlive(int pidfd) {
  pollfd wanted = {pidfd, POLLIN, 0};
  return ::poll(&wanted, 1, 0) == 0;
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

TomlEntitlements::TomlEntitlements(TomlEntitlementsOptions options, ProgramInspector& inspector, Log& log,
                                   Counters& counters)
    : options_(std::move(options)), inspector_(inspector), log_(log), counters_(counters) {}

void TomlEntitlements::report(const std::string& path, const FileIdentity& identity,
                              const TomlError& problem) {
  const auto told = reported_.find(path);
  if (told != reported_.end() && told->second == identity) return;
  counters_.add(Reason::badEntitlementsFile);
  log_.error("entitlements: %s", problem.text.c_str());
}

void TomlEntitlements::readFile(const std::string& name) {
  const std::string path = options_.folder + "/" + name;
  auto contents = readRegularFile(path, kMaxTomlBytes);
  if (const auto* wrong = std::get_if<std::string>(&contents)) {
    const FileIdentity identity = identityOf(path);
    report(path, identity, tomlError(path, 0, *wrong + ". The file is ignored"));
    reported_[path] = identity;
    files_.push_back({path, identity});
    if (changedJustNow(identity)) certain_ = false;
    return;
  }
  const auto& file = std::get<FileContents>(contents);
  files_.push_back({path, file.identity});
  if (changedJustNow(file.identity)) certain_ = false;
  const bool trustedOwner =
      file.identity.owner == 0 || (options_.trustedUser && file.identity.owner == *options_.trustedUser);
  if (!trustedOwner || (file.identity.mode & (S_IWGRP | S_IWOTH)) != 0) {
    report(path, file.identity, tomlError(path, 0, "others than root can write the file. It is ignored"));
  } else {
    auto parsed = parseEntitlements(file.bytes, path);
    if (const auto* error = std::get_if<TomlError>(&parsed)) {
      report(path, file.identity, TomlError{error->text + ". The file is ignored"});
    } else {
      auto& result = std::get<EntitlementGrants>(parsed);
      for (const TomlError& problem : result.problems) report(path, file.identity, problem);
      std::move(result.grants.begin(), result.grants.end(), std::back_inserter(grants_));
    }
  }
  reported_[path] = file.identity;
}

bool TomlEntitlements::isCurrent() const {
  return certain_ && identityOf(options_.folder) == folder_ &&
         std::all_of(files_.begin(), files_.end(),
                     [](const File& file) { return identityOf(file.path) == file.identity; });
}

void TomlEntitlements::refresh() {
  if (isCurrent()) return;
  certain_ = true;
  files_.clear();
  grants_.clear();
  folder_ = identityOf(options_.folder);
  if (changedJustNow(folder_)) certain_ = false;
  std::vector<std::string> names;
  if (DIR* folder = ::opendir(options_.folder.c_str())) {
    while (const dirent* entry = ::readdir(folder)) {
      const std::string_view name = entry->d_name;
      if (name.ends_with(".toml") && !name.starts_with('.')) names.emplace_back(name);
    }
    ::closedir(folder);
  }
  std::sort(names.begin(), names.end());
  for (const std::string& name : names) readFile(name);
  std::erase_if(reported_, [this](const auto& entry) REQUIRES(mutex_) {
    return std::none_of(files_.begin(), files_.end(),
                        [&](const File& file) { return file.path == entry.first; });
  });
}

void TomlEntitlements::sayOnce(const char* why) {
  if (std::exchange(saidNoInspection_, true)) return;
  log_.error("entitlements: Grants by executable cannot match: %s", why);
}

bool TomlEntitlements::runs(const PeerCredentials& peer, const std::string& executable) {
  if (peer.pidfd.get() < 0) {
    sayOnce("the kernel does not tell which process is connected");
    return false;
  }
  struct stat status = {};
  if (::stat(executable.c_str(), &status) != 0) return false;
  const auto program = inspector_.runningProgram(peer.pid);
  if (const int* error = std::get_if<int>(&program)) {
    // A process that has ended is no lack of privilege.
    if (*error != ENOENT && *error != ESRCH && isAlive(peer.pidfd.get())) sayOnce(errorText(*error).c_str());
    return false;
  }
  // Alive after the look means that the number stood for this process when it was looked at.
  return std::get<ProgramIdentity>(program) == ProgramIdentity{status.st_dev, status.st_ino} &&
         isAlive(peer.pidfd.get());
}

bool TomlEntitlements::matches(const EntitlementGrant& grant, const PeerCredentials& peer) {
  if (grant.user && !isUser(*grant.user, peer)) return false;
  if (grant.group && !isMember(*grant.group, peer)) return false;
  if (grant.securityLabel && *grant.securityLabel != peer.securityLabel) return false;
  return !grant.executable || runs(peer, *grant.executable);
}

Value TomlEntitlements::valueFor(const PeerCredentials& peer, std::string_view key) {
  MutexLock lock(mutex_);
  refresh();
  Value result;
  for (const EntitlementGrant& grant : grants_) {
    const auto value = grant.values.find(key);
    if (value == grant.values.end() || !matches(grant, peer)) continue;
    if (value->second.boolValue()) return value->second;
    if (result.isNull()) result = value->second;
  }
  return result;
}

}  // namespace kyt
