#include "platform/linux/system/TomlEntitlements.h"

#include <algorithm>
#include <iterator>
#include <utility>

#include "platform/linux/system/EntitlementMatch.h"

namespace kyt {

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
  EntitlementsFile file = readEntitlementsFile(options_.folder + "/" + name, options_.trustedUser);
  if (changedJustNow(file.identity)) certain_ = false;
  for (const TomlError& problem : file.problems) report(file.path, file.identity, problem);
  std::move(file.grants.begin(), file.grants.end(), std::back_inserter(grants_));
  reported_[file.path] = file.identity;
  files_.push_back({std::move(file.path), file.identity});
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
  for (const std::string& name : entitlementsFiles(options_.folder).names) readFile(name);
  std::erase_if(reported_, [this](const auto& entry) REQUIRES(mutex_) {
    return std::none_of(files_.begin(), files_.end(),
                        [&](const File& file) { return file.path == entry.first; });
  });
}

void TomlEntitlements::sayOnce(const std::string& why) {
  if (std::exchange(saidNoInspection_, true)) return;
  log_.error("entitlements: Grants by executable cannot match: %s", why.c_str());
}

std::string TomlEntitlements::executableOf(const PeerCredentials& peer) {
  std::string path = inspector_.programPath(peer.pid);
  return EntitlementMatch(peer, inspector_).isAlive() ? path : std::string();
}

Value TomlEntitlements::valueFor(const PeerCredentials& peer, std::string_view key) {
  MutexLock lock(mutex_);
  refresh();
  Value result;
  EntitlementMatch match(peer, inspector_);
  for (const EntitlementGrant& grant : grants_) {
    const auto value = grant.values.find(key);
    if (value == grant.values.end() || !match.matches(grant)) continue;
    if (result.isNull() || value->second.boolValue()) result = value->second;
    if (result.boolValue()) break;
  }
  if (match.lack()) sayOnce(*match.lack());
  return result;
}

}  // namespace kyt
