// Who may connect, as entitlements.d/*.toml grants it:
//
//   [[grant]]
//   user = "videocall"        # a name or a number; and/or group, executable (a path), security_label: all
//   must match "com.vantu.private.kytreportingd" = true
//
// Any matching grant suffices. Only files that nobody but root can write count (`trustedUser` besides, for a
// private root). What is wrong makes a grant or a file count for nothing, never for more: a key without a
// point that is no criterion is taken for a misspelt one. Each problem is logged once for each state of the
// file.
//
// The files are looked at (a stat each) for every connection and read again when they changed.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

#include "platform/Counters.h"
#include "platform/Entitlements.h"
#include "platform/Log.h"
#include "platform/Mutex.h"
#include "platform/linux/system/Files.h"
#include "platform/linux/system/ProgramInspector.h"
#include "platform/linux/system/Toml.h"

namespace kyt {

struct EntitlementGrant {
  // A name, or a number when the file says one.
  std::optional<std::variant<std::string, int64_t>> user, group;
  std::optional<std::string> executable, securityLabel;
  std::map<std::string, Value, std::less<>> values;
};

struct EntitlementGrants {
  std::vector<EntitlementGrant> grants;
  std::vector<TomlError> problems;  // of grants that were left out
};

// The grants of one file's text; an error when it cannot be read as a whole.
[[nodiscard]] std::variant<EntitlementGrants, TomlError> parseEntitlements(std::string_view text,
                                                                           std::string_view name);

struct TomlEntitlementsOptions {
  std::string folder;
  std::optional<uint32_t> trustedUser;  // may own the files besides root
};

class TomlEntitlements final : public Entitlements {
 public:
  TomlEntitlements(TomlEntitlementsOptions options, ProgramInspector& inspector, Log& log,
                   Counters& counters);
  [[nodiscard]] Value valueFor(const PeerCredentials& peer, std::string_view key) override EXCLUDES(mutex_);

 private:
  struct File {
    std::string path;
    FileIdentity identity;
  };
  void refresh() REQUIRES(mutex_);
  [[nodiscard]] bool isCurrent() const REQUIRES(mutex_);
  void readFile(const std::string& name) REQUIRES(mutex_);
  void report(const std::string& path, const FileIdentity& identity, const TomlError& problem)
      REQUIRES(mutex_);
  [[nodiscard]] bool matches(const EntitlementGrant& grant, const PeerCredentials& peer) REQUIRES(mutex_);
  [[nodiscard]] bool runs(const PeerCredentials& peer, const std::string& executable) REQUIRES(mutex_);
  void sayOnce(const char* why) REQUIRES(mutex_);

  const TomlEntitlementsOptions options_;
  ProgramInspector& inspector_;
  Log& log_;
  Counters& counters_;
  Mutex mutex_;
  bool certain_ GUARDED_BY(mutex_) = false;  // what was read holds as long as the identities do
  bool saidNoInspection_ GUARDED_BY(mutex_) = false;
  FileIdentity folder_ GUARDED_BY(mutex_);
  std::vector<File> files_ GUARDED_BY(mutex_);
  std::vector<EntitlementGrant> grants_ GUARDED_BY(mutex_);
  std::map<std::string, FileIdentity> reported_ GUARDED_BY(mutex_);
};

}  // namespace kyt
