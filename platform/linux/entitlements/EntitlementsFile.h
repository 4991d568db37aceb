// The files of entitlements.d: which there are, and the grants of each:
//
//   [[grant]]
//   user = "videocall"        # a name or a number; and/or group, executable (a path), security_label: all must match
//   "com.vantu.private.kytreportingd" = true
//
// Only files that nobody but root can write count (a trusted user besides, for a private root). What is wrong makes a
// grant or a file count for nothing, never for more: a key without a point that is no criterion is taken for a misspelt
// one. The daemon reads them, and kytctl to say why a client is refused.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "platform/linux/files/Files.h"
#include "platform/linux/toml/Toml.h"
#include "platform/objects/Value.h"

namespace kyt {

// A name, or a number when the file says one.
using NameOrNumber = std::variant<std::string, int64_t>;

struct EntitlementGrant {
  uint32_t line = 0;  // where it begins
  std::optional<NameOrNumber> user, group;
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

struct EntitlementsFile {
  std::string path;
  FileIdentity identity;
  bool unreadable = false;  // to this process; its contents are unknown
  int error = 0;            // errno, where the system refused to read it
  bool ignored = false;     // as a whole; `problems` says why
  std::vector<EntitlementGrant> grants;
  std::vector<TomlError> problems;
};

// `trustedUser` may own it besides root.
[[nodiscard]] EntitlementsFile readEntitlementsFile(const std::string& path,
                                                    std::optional<uint32_t> trustedUser);

struct EntitlementsListing {
  std::vector<std::string> names;   // of the files that count, in their order
  std::vector<std::string> others;  // that do not, for their names
  int error = 0;                    // errno when the folder cannot be read; then no names
};
[[nodiscard]] EntitlementsListing entitlementsFiles(const std::string& folder);

}  // namespace kyt
