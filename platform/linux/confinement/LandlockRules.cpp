#include "platform/linux/confinement/LandlockRules.h"

#include <fcntl.h>
#include <linux/landlock.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <utility>

namespace kyt {
namespace {

// What the kernel knows may be newer than the headers, so what came later is written out: truncation with
// version 3, TCP with version 4, device controls with version 5, scopes with version 6.
constexpr uint64_t kTruncate = 1ULL << 14;
constexpr uint64_t kDeviceControl = 1ULL << 15;
constexpr uint64_t kBindTCP = 1ULL << 0;
constexpr uint64_t kScopeAbstractSockets = 1ULL << 0;
constexpr uint64_t kScopeSignals = 1ULL << 1;

struct RulesetAttributes {
  uint64_t files;
  uint64_t network;
  uint64_t scopes;
};

constexpr uint64_t kRead = LANDLOCK_ACCESS_FS_READ_FILE | LANDLOCK_ACCESS_FS_READ_DIR;
constexpr uint64_t kWrite = kRead | LANDLOCK_ACCESS_FS_WRITE_FILE | LANDLOCK_ACCESS_FS_REMOVE_FILE |
                            LANDLOCK_ACCESS_FS_MAKE_REG | kTruncate;
constexpr uint64_t kFolders = kWrite | LANDLOCK_ACCESS_FS_MAKE_DIR;
constexpr uint64_t kSockets = kRead | LANDLOCK_ACCESS_FS_REMOVE_FILE | LANDLOCK_ACCESS_FS_MAKE_SOCK;
// A rule for something else than a folder may name only these.
constexpr uint64_t kOfFiles = LANDLOCK_ACCESS_FS_EXECUTE | LANDLOCK_ACCESS_FS_WRITE_FILE |
                              LANDLOCK_ACCESS_FS_READ_FILE | kTruncate | kDeviceControl;

uint64_t fileRights(long version) {
  uint64_t rights = (LANDLOCK_ACCESS_FS_MAKE_SYM << 1) - 1;  // all of version 1
  if (version >= 2) rights |= LANDLOCK_ACCESS_FS_REFER;
  if (version >= 3) rights |= kTruncate;
  if (version >= 5) rights |= kDeviceControl;
  return rights;
}

size_t sizeOfAttributes(long version) {
  if (version < 4) return sizeof(RulesetAttributes::files);
  if (version < 6) return sizeof(RulesetAttributes::files) + sizeof(RulesetAttributes::network);
  return sizeof(RulesetAttributes);
}

std::vector<std::string> unknownTo(long version) {
  std::vector<std::string> missing;
  if (version < 3)
    missing.emplace_back("stop the cutting of files that may only be read by Landlock (6.2 can)");
  if (version < 4) missing.emplace_back("stop the binding of TCP ports by Landlock (6.7 can)");
  if (version < 5) missing.emplace_back("stop device controls by Landlock (6.10 can)");
  if (version < 6)
    missing.emplace_back("stop signals and abstract sockets to processes outside by Landlock (6.12 can)");
  return missing;
}

std::string failed(const std::string& what, int error) {
  return what + ": " + errorText(error);
}

std::optional<std::string> allow(int ruleset, const std::string& path, uint64_t rights, bool mayBeMissing) {
  const Descriptor place = ownDescriptor(::open(path.c_str(), O_PATH | O_CLOEXEC));
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

}  // namespace

std::variant<LandlockRules, std::string> LandlockRules::of(const ConfinementProfile& profile,
                                                           const Options& options) {
  const long version = ::syscall(SYS_landlock_create_ruleset, nullptr, 0, LANDLOCK_CREATE_RULESET_VERSION);
  if (version < 1) return failed("the kernel has no Landlock", errno);
  const uint64_t known = fileRights(version);
  const RulesetAttributes attributes = {
      known, kBindTCP, kScopeSignals | (options.abstractSockets ? 0 : kScopeAbstractSockets)};
  LandlockRules rules;
  rules.missing_ = unknownTo(version);
  rules.ruleset_ = ownDescriptor(
      static_cast<int>(::syscall(SYS_landlock_create_ruleset, &attributes, sizeOfAttributes(version), 0)));
  if (!rules.ruleset_) return failed("landlock_create_ruleset", errno);
  const struct {
    const std::vector<std::string>& paths;
    uint64_t rights;
    bool mayBeMissing;
  } kinds[] = {{profile.read, kRead, true},
               {profile.write, kWrite, false},
               {profile.folders, kFolders, false},
               {profile.sockets, kSockets, false}};
  for (const auto& kind : kinds) {
    for (const std::string& path : kind.paths) {
      if (auto error = allow(rules.ruleset_.get(), path, kind.rights & known, kind.mayBeMissing))
        return *error;
    }
  }
  return rules;
}

std::optional<std::string> LandlockRules::enter() const {
  if (::syscall(SYS_landlock_restrict_self, ruleset_.get(), 0) != 0)
    return failed("landlock_restrict_self", errno);
  return std::nullopt;
}

}  // namespace kyt
