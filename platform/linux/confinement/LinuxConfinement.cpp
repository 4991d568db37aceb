#include "platform/linux/confinement/LinuxConfinement.h"

#include <sys/prctl.h>
#include <sys/resource.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>

#include "platform/linux/confinement/LandlockRules.h"
#include "platform/linux/files/Files.h"

namespace kyt {
namespace {

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

// All that a build with a sanitizer leaves out of its confinement, because its runtime cannot run with it:
// its shadow memory takes terabytes of addresses, the leak check at exit is a thread without a thread's rights
// that attaches to all others, and it makes some calls in their old forms.
constexpr bool kDumpable = kSanitized;
constexpr bool kAddressSpace = !kSanitized;
constexpr const char* kCallsOfSanitizers[] = {
    "sigaltstack",
    "ptrace",
    "prctl(PR_SET_PTRACER)",
    "prctl(PR_GET_DUMPABLE)",
    "open(*, no O_TRUNC)",
    "getdents",
    "clone(has CLONE_VM|CLONE_FS|CLONE_FILES|CLONE_UNTRACED)",
};

std::string failed(const std::string& what, int error) {
  return what + ": " + errorText(error);
}

void allowSanitizer(SystemCallProfile& profile) {
  for (const char* text : kCallsOfSanitizers) {
    const auto rule = std::get<SystemCallRule>(parseSystemCallRule(text));
    std::erase_if(profile.kill, [&rule](const SystemCallRule& each) { return each.call == rule.call; });
    profile.allow.push_back(rule);
  }
}

// Neither limit above what the process was started with.
std::optional<std::string> limit(int resource, const char* name, std::optional<uint64_t> most) {
  if (!most) return std::nullopt;
  rlimit now = {};
  if (::getrlimit(static_cast<__rlimit_resource_t>(resource), &now) != 0) return failed(name, errno);
  now.rlim_max = std::min<rlim_t>(now.rlim_max, *most);
  now.rlim_cur = now.rlim_max;
  if (::setrlimit(static_cast<__rlimit_resource_t>(resource), &now) != 0) return failed(name, errno);
  return std::nullopt;
}

std::optional<std::string> enterLimits(const ResourceLimits& limits) {
  if (auto error = limit(RLIMIT_CORE, "core", limits.core)) return error;
  if (auto error = limit(RLIMIT_NOFILE, "descriptors", limits.descriptors)) return error;
  if (!kAddressSpace) return std::nullopt;
  return limit(RLIMIT_AS, "address_space", limits.addressSpace);
}

// The service manager's socket may be an abstract one, in containers for example; it must stay reachable.
bool managerHasAbstractSocket() {
  const char* socket = std::getenv("NOTIFY_SOCKET");
  return socket != nullptr && *socket == '@';
}

}  // namespace

bool LinuxConfinement::staysDumpable() {
  return kDumpable;
}

bool LinuxConfinement::limitsAddressSpace() {
  return kAddressSpace;
}

uint64_t LinuxConfinement::descriptorLimit() {
  // Where the system does not tell: what it gives a process that asks for nothing. With none no user would have a share.
  constexpr uint64_t kUsual = 1024;
  rlimit now = {};
  return ::getrlimit(RLIMIT_NOFILE, &now) == 0 ? now.rlim_cur : kUsual;
}

std::variant<ConfinementProfile, TomlError> LinuxConfinement::read(std::string_view profileName) const {
  const std::string file = folder_ + "/" + std::string(profileName) + ".profile";
  auto text = readTomlText(file);
  if (auto* error = std::get_if<TomlError>(&text)) return std::move(*error);
  return parseProfile(std::get<std::string>(text), file, variables_);
}

std::vector<std::string> LinuxConfinement::openPaths(std::string_view profileName) const {
  const auto parsed = read(profileName);
  const auto* profile = std::get_if<ConfinementProfile>(&parsed);
  if (profile == nullptr) return {};
  std::vector<std::string> paths = profile->read;
  paths.insert(paths.end(), profile->write.begin(), profile->write.end());
  paths.insert(paths.end(), profile->folders.begin(), profile->folders.end());
  paths.insert(paths.end(), profile->sockets.begin(), profile->sockets.end());
  return paths;
}

std::optional<std::string> LinuxConfinement::enter(std::string_view profileName) {
  auto parsed = read(profileName);
  if (const auto* error = std::get_if<TomlError>(&parsed)) return error->text;
  auto& profile = std::get<ConfinementProfile>(parsed);
  if (kSanitized) allowSanitizer(profile.systemCalls);

  auto made = LandlockRules::of(profile, {managerHasAbstractSocket()});
  if (auto* error = std::get_if<std::string>(&made)) return std::move(*error);
  const auto& files = std::get<LandlockRules>(made);
  if (auto error = enterLimits(profile.limits)) return error;
  if (::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0) return failed("no_new_privs", errno);
  if (!kDumpable && ::prctl(PR_SET_DUMPABLE, 0, 0, 0, 0) != 0) return failed("dumpable", errno);
  if (auto error = files.enter()) return error;
  if (auto error = enterSystemCallFilter(profile.systemCalls)) return error;
  systemCalls_ = std::move(profile.systemCalls);
  notEnforced_ = files.missing();
  return std::nullopt;
}

std::optional<std::string> LinuxConfinement::endStart() {
  auto error = endStartOfSystemCallFilter(systemCalls_);
  if (!error) systemCalls_ = {};
  return error;
}

}  // namespace kyt
