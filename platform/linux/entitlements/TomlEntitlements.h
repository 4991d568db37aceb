// Who may connect, as entitlements.d/*.toml grants it (EntitlementsFile.h). Any matching grant suffices. Each problem of a
// file is logged once for each state of the file.
//
// The files are looked at (a stat each) for every connection and read again when they changed. What the machine cannot
// read at the moment (no descriptor, no memory) keeps its former grants, is tried again for the next connection, and is
// logged at most once a minute; so are users and groups by name (AccountNumbers.h). What a peer runs, which may take long to learn, is asked with nothing locked.
#pragma once

#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

#include "platform/Entitlements.h"
#include "platform/base/Clock.h"
#include "platform/base/Counters.h"
#include "platform/base/Mutex.h"
#include "platform/linux/entitlements/AccountNumbers.h"
#include "platform/linux/entitlements/EntitlementsFile.h"
#include "platform/linux/files/Files.h"
#include "platform/linux/helpers/ProgramInspector.h"
#include "platform/linux/toml/Toml.h"
#include "platform/queues/Log.h"

namespace kyt {

struct TomlEntitlementsOptions {
  std::string folder;
  std::optional<uint32_t> trustedUser;  // may own the files besides root
};

class TomlEntitlements final : public Entitlements {
 public:
  TomlEntitlements(TomlEntitlementsOptions options, ProgramInspector& inspector, Log& log, Counters& counters,
                   const Clock& clock);
  [[nodiscard]] Value valueFor(const PeerCredentials& peer, std::string_view key) override EXCLUDES(mutex_);
  [[nodiscard]] std::string executableOf(const PeerCredentials& peer) override;

 private:
  struct File {
    std::string path;
    FileIdentity identity;
    std::vector<EntitlementGrant> grants;
  };
  [[nodiscard]] std::shared_ptr<const std::vector<EntitlementGrant>> currentGrants() EXCLUDES(mutex_);
  void refresh() REQUIRES(mutex_);
  [[nodiscard]] bool isCurrent() const REQUIRES(mutex_);
  [[nodiscard]] std::vector<std::string> paths(const std::vector<File>& former) REQUIRES(mutex_);
  void readFile(const std::string& path, std::vector<File>& former) REQUIRES(mutex_);
  void report(const std::string& path, const FileIdentity& identity, const TomlError& problem)
      REQUIRES(mutex_);
  void reportMomentary(const std::string& path, int error) REQUIRES(mutex_);
  void sayOnce(const std::string& why) EXCLUDES(mutex_);

  const TomlEntitlementsOptions options_;
  ProgramInspector& inspector_;
  Log& log_;
  Counters& counters_;
  const Clock& clock_;
  AccountNumbers numbers_;  // synchronises itself
  Mutex mutex_;
  bool certain_ GUARDED_BY(mutex_) = false;  // what was read holds as long as the identities do
  bool saidNoInspection_ GUARDED_BY(mutex_) = false;
  FileIdentity folder_ GUARDED_BY(mutex_);
  std::vector<File> files_ GUARDED_BY(mutex_);
  std::shared_ptr<const std::vector<EntitlementGrant>> grants_ GUARDED_BY(mutex_);  // of all files
  std::map<std::string, FileIdentity> reported_ GUARDED_BY(mutex_);
};

}  // namespace kyt
