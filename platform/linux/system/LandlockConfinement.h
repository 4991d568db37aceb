// Confinement by profile: what the process may do with files, from a list of folders that a profile file
// names.
//
// The profile `NAME.profile` is a TOML file with the arrays `read`, `write` and `sockets`. Their entries are
// absolute paths, or begin with a variable ("${STATE}/…"), whose values the composition root knows.
// Everything beneath `read` may be read and listed; beneath `write` also written, created, renamed and
// removed (files, not folders); beneath `sockets` sockets may be made and removed; nothing may be executed,
// linked into other folders or made a device, and nowhere else a socket. A path of `read` that does not exist
// is left out, the others must exist. Where the kernel can, binding TCP ports is forbidden too; connecting is
// not, since storebags decide the addresses.
//
// Files that are open before stay usable. What is entered holds for the calling thread and those it starts,
// for ever, so it is entered before any thread exists. The process also gives up gaining privileges
// (no_new_privs) and dumping core; under a sanitizer it stays dumpable, since the leak check at exit attaches
// to the process and could not.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "platform/System.h"
#include "platform/linux/system/Toml.h"

namespace kyt {

struct ConfinementProfile {
  std::vector<std::string> read, write, sockets;
};

using ProfileVariables = std::map<std::string, std::string, std::less<>>;

// An error for unknown keys and variables, wrong types and relative paths. An entry whose variable has an
// empty value is left out.
[[nodiscard]] std::variant<ConfinementProfile, TomlError> parseProfile(std::string_view text,
                                                                       std::string_view name,
                                                                       const ProfileVariables& variables);

class LandlockConfinement final : public Confinement {
 public:
  // `folder`: where the profiles are.
  LandlockConfinement(std::string folder, ProfileVariables variables)
      : folder_(std::move(folder)), variables_(std::move(variables)) {}
  [[nodiscard]] std::optional<std::string> enter(std::string_view profileName) override;
  // True in builds with a sanitizer.
  [[nodiscard]] static bool staysDumpable();

 private:
  const std::string folder_;
  const ProfileVariables variables_;
};

}  // namespace kyt
