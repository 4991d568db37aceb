#include "platform/linux/system/LandlockConfinement.h"

#include <fcntl.h>
#include <linux/landlock.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>

#include "platform/linux/system/Files.h"

namespace kyt {
namespace {

// What the kernel knows may be newer than the headers, so what came later is written out: truncation with
// version 3, TCP with version 4, device controls with version 5.
constexpr uint64_t kTruncate = 1ULL << 14;
constexpr uint64_t kDeviceControl = 1ULL << 15;
constexpr uint64_t kBindTCP = 1ULL << 0;

struct RulesetAttributes {
  uint64_t handledFiles;
  uint64_t handledNetwork;
};

constexpr uint64_t kRead = LANDLOCK_ACCESS_FS_READ_FILE | LANDLOCK_ACCESS_FS_READ_DIR;
constexpr uint64_t kWrite = kRead | LANDLOCK_ACCESS_FS_WRITE_FILE | LANDLOCK_ACCESS_FS_REMOVE_FILE |
                            LANDLOCK_ACCESS_FS_MAKE_REG | kTruncate;
constexpr uint64_t kSockets = kRead | LANDLOCK_ACCESS_FS_REMOVE_FILE | LANDLOCK_ACCESS_FS_MAKE_SOCK;
// A rule for something else than a folder may name only these.
constexpr uint64_t kOfFiles = LANDLOCK_ACCESS_FS_EXECUTE | LANDLOCK_ACCESS_FS_WRITE_FILE |
                              LANDLOCK_ACCESS_FS_READ_FILE | kTruncate | kDeviceControl;

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr bool kSanitized = true;
#elif defined(__has_feature)
#if __has_feature(address_sanitizer) || __has_feature(thread_sanitizer)
constexpr bool kSanitized = true;
#else
constexpr bool kSanitized = false;
#endif
#else
constexpr bool kSanitized = false;
#endif

uint64_t fileRights(long version) {
  uint64_t rights = (LANDLOCK_ACCESS_FS_MAKE_SYM << 1) - 1;  // all of version 1
  if (version >= 2) rights |= LANDLOCK_ACCESS_FS_REFER;
  if (version >= 3) rights |= kTruncate;
  if (version >= 5) rights |= kDeviceControl;
  return rights;
}

std::string failed(const std::string& what, int error) {
  return what + ": " + errorText(error);
}

std::optional<std::string> allow(int ruleset, const std::string& path, uint64_t rights, bool mayBeMissing) {
  const FileHandle place(::open(path.c_str(), O_PATH | O_CLOEXEC));
  if (!place) {
    if (mayBeMissing && (errno == ENOENT || errno == ENOTDIR || errno == EACCES)) return std::nullopt;
    return failed(path, errno);
  }
  struct stat status = {};
  if (::fstat(place.get(), &status) != 0) return failed(path, errno);
  landlock_path_beneath_attr rule = {};
  rule.allowed_access = S_ISDIR(status.st_mode) ? rights : rights & kOfFiles;
  rule.parent_fd = place.get();
  if (::syscall(SYS_landlock_add_rule, ruleset, LANDLOCK_RULE_PATH_BENEATH, &rule, 0) != 0)
    return failed(path, errno);
  return std::nullopt;
}

// The path with its variable replaced; empty when it falls away; an error's text as the second.
std::pair<std::string, const char*> expanded(std::string_view entry, const ProfileVariables& variables) {
  std::string path(entry);
  if (entry.starts_with("${")) {
    const size_t end = entry.find('}');
    if (end == std::string_view::npos) return {"", "has a variable without an end"};
    const auto variable = variables.find(entry.substr(2, end - 2));
    if (variable == variables.end()) return {"", "names an unknown variable"};
    if (variable->second.empty()) return {"", nullptr};
    path = variable->second + std::string(entry.substr(end + 1));
  }
  if (!path.starts_with('/') || path.find('\0') != std::string::npos) return {"", "is no absolute path"};
  if (path.find("${") != std::string::npos) return {"", "has a variable in its middle"};
  return {std::move(path), nullptr};
}

}  // namespace

std::variant<ConfinementProfile, TomlError> parseProfile(std::string_view text, std::string_view name,
                                                         const ProfileVariables& variables) {
  auto parsed = parseToml(text, name);
  if (auto* error = std::get_if<TomlError>(&parsed)) return std::move(*error);
  ConfinementProfile profile;
  for (const auto& [key, node] : std::get<TomlTable>(parsed)) {
    std::vector<std::string>* paths = key == "read"      ? &profile.read
                                      : key == "write"   ? &profile.write
                                      : key == "sockets" ? &profile.sockets
                                                         : nullptr;
    if (paths == nullptr) return tomlError(name, node.line, "unknown key \"" + key + "\"");
    if (node.array() == nullptr)
      return tomlError(name, node.line, "\"" + key + "\" must be an array of texts");
    for (const TomlNode& entry : *node.array()) {
      if (entry.text() == nullptr)
        return tomlError(name, entry.line, "\"" + key + "\" must be an array of texts");
      auto [path, wrong] = expanded(*entry.text(), variables);
      if (wrong != nullptr) return tomlError(name, entry.line, "\"" + *entry.text() + "\" " + wrong);
      if (!path.empty()) paths->push_back(std::move(path));
    }
  }
  return profile;
}

bool LandlockConfinement::staysDumpable() {
  return kSanitized;
}

std::optional<std::string> LandlockConfinement::enter(std::string_view profileName) {
  const std::string file = folder_ + "/" + std::string(profileName) + ".profile";
  auto text = readTomlText(file);
  if (const auto* error = std::get_if<TomlError>(&text)) return error->text;
  auto parsed = parseProfile(std::get<std::string>(text), file, variables_);
  if (const auto* error = std::get_if<TomlError>(&parsed)) return error->text;
  const auto& profile = std::get<ConfinementProfile>(parsed);

  const long version = ::syscall(SYS_landlock_create_ruleset, nullptr, 0, LANDLOCK_CREATE_RULESET_VERSION);
  if (version < 1) return failed("the kernel has no Landlock", errno);
  const uint64_t known = fileRights(version);
  const RulesetAttributes attributes = {known, kBindTCP};
  const size_t size = version >= 4 ? sizeof attributes : sizeof attributes.handledFiles;
  const FileHandle ruleset(static_cast<int>(::syscall(SYS_landlock_create_ruleset, &attributes, size, 0)));
  if (!ruleset) return failed("landlock_create_ruleset", errno);
  for (const std::string& path : profile.read) {
    if (auto error = allow(ruleset.get(), path, kRead & known, true)) return error;
  }
  for (const std::string& path : profile.write) {
    if (auto error = allow(ruleset.get(), path, kWrite & known, false)) return error;
  }
  for (const std::string& path : profile.sockets) {
    if (auto error = allow(ruleset.get(), path, kSockets & known, false)) return error;
  }
  if (::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0) return failed("no_new_privs", errno);
  if (!kSanitized && ::prctl(PR_SET_DUMPABLE, 0, 0, 0, 0) != 0) return failed("dumpable", errno);
  if (::syscall(SYS_landlock_restrict_self, ruleset.get(), 0) != 0)
    return failed("landlock_restrict_self", errno);
  return std::nullopt;
}

}  // namespace kyt
