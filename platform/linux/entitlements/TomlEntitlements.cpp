#include "platform/linux/entitlements/TomlEntitlements.h"

#include <algorithm>
#include <cerrno>
#include <utility>

#include "platform/base/TextEscape.h"
#include "platform/linux/entitlements/EntitlementMatch.h"

namespace kyt {

TomlEntitlements::TomlEntitlements(TomlEntitlementsOptions options, ProgramInspector& inspector, Log& log,
                                   Counters& counters, const Clock& clock)
    : options_(std::move(options)), inspector_(inspector), log_(log), counters_(counters), clock_(clock) {}

void TomlEntitlements::report(const std::string& path, const FileIdentity& identity,
                              const TomlError& problem) {
  const auto told = reported_.find(path);
  if (told != reported_.end() && told->second == identity) return;
  counters_.add(Reason::badEntitlementsFile);
  log_.error("entitlements: %s", problem.text.c_str());
}

void TomlEntitlements::reportMomentary(const std::string& path, int error) {
  if (!counters_.addAndMayLog(Reason::badEntitlementsFile, clock_.monotonic())) return;
  log_.error("entitlements: %s: %s. What it granted before counts until it can be read",
             escapedText(path).c_str(), errorText(error).c_str());
}

void TomlEntitlements::readFile(const std::string& path, std::vector<File>& former) {
  EntitlementsFile file = readEntitlementsFile(path, options_.trustedUser);
  if (file.error != 0 || changedJustNow(file.identity)) certain_ = false;
  if (isMomentary(file.error)) {
    reportMomentary(path, file.error);
    const auto known =
        std::find_if(former.begin(), former.end(), [&](const File& one) { return one.path == path; });
    if (known != former.end()) files_.push_back(std::move(*known));
    return;
  }
  for (const TomlError& problem : file.problems) report(file.path, file.identity, problem);
  reported_[file.path] = file.identity;
  files_.push_back({std::move(file.path), file.identity, std::move(file.grants)});
}

bool TomlEntitlements::isCurrent() const {
  return certain_ && identityOf(options_.folder) == folder_ &&
         std::all_of(files_.begin(), files_.end(),
                     [](const File& file) { return identityOf(file.path) == file.identity; });
}

// Of the files there are; of those known when that cannot be told now.
std::vector<std::string> TomlEntitlements::paths(const std::vector<File>& former) {
  std::vector<std::string> paths;
  const EntitlementsListing listing = entitlementsFiles(options_.folder);
  for (const std::string& name : listing.names) paths.push_back(options_.folder + "/" + name);
  if (listing.error == 0) return paths;
  certain_ = false;
  if (isMomentary(listing.error)) {
    reportMomentary(options_.folder, listing.error);
    for (const File& file : former) paths.push_back(file.path);
  } else if (listing.error != ENOENT) {
    report(options_.folder, folder_,
           tomlError(options_.folder, 0, errorText(listing.error) + ". Nobody is granted anything"));
    reported_[options_.folder] = folder_;
  }
  return paths;
}

void TomlEntitlements::refresh() {
  if (isCurrent()) return;
  std::vector<File> former = std::exchange(files_, {});
  certain_ = true;
  folder_ = identityOf(options_.folder);
  if (changedJustNow(folder_)) certain_ = false;
  for (const std::string& path : paths(former)) readFile(path, former);
  std::erase_if(reported_, [this](const auto& entry) REQUIRES(mutex_) {
    return entry.first != options_.folder &&
           std::none_of(files_.begin(), files_.end(),
                        [&](const File& file) { return file.path == entry.first; });
  });
  auto grants = std::make_shared<std::vector<EntitlementGrant>>();
  for (const File& file : files_) grants->insert(grants->end(), file.grants.begin(), file.grants.end());
  grants_ = std::move(grants);
}

void TomlEntitlements::sayOnce(const std::string& why) {
  {
    MutexLock lock(mutex_);
    if (std::exchange(saidNoInspection_, true)) return;
  }
  log_.error("entitlements: Grants by executable cannot match: %s", why.c_str());
}

std::string TomlEntitlements::executableOf(const PeerCredentials& peer) {
  std::string path = inspector_.programPath(peer.pid);
  return EntitlementMatch(peer, inspector_, numbers_).isAlive() ? path : std::string();
}

std::shared_ptr<const std::vector<EntitlementGrant>> TomlEntitlements::currentGrants() {
  MutexLock lock(mutex_);
  refresh();
  return grants_;
}

Value TomlEntitlements::valueFor(const PeerCredentials& peer, std::string_view key) {
  const auto grants = currentGrants();
  Value result;
  EntitlementMatch match(peer, inspector_, numbers_);
  for (const EntitlementGrant& grant : *grants) {
    const auto value = grant.values.find(key);
    if (value == grant.values.end() || !match.matches(grant)) continue;
    if (result.isNull() || value->second.boolValue()) result = value->second;
    if (result.boolValue()) break;
  }
  if (match.lack()) sayOnce(*match.lack());
  return result;
}

}  // namespace kyt
