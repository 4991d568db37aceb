// Confinement by profile: what the process may do with files (LandlockRules), which system calls it may make
// (SystemCallFilter), and how much it may take (limits), as a profile file says (ConfinementProfile).
//
// What is entered holds for the calling thread and those it starts, for ever, so it is entered before any
// thread exists. The process also gives up gaining privileges (no_new_privs) and dumping core. There is no way
// to run without it; what a build with a sanitizer leaves out stands in one table in the source.
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

#include "platform/Confinement.h"
#include "platform/linux/confinement/ConfinementProfile.h"

namespace kyt {

class LinuxConfinement final : public Confinement {
 public:
  // `folder`: where the profiles are.
  LinuxConfinement(std::string folder, ProfileVariables variables)
      : folder_(std::move(folder)), variables_(std::move(variables)) {}
  [[nodiscard]] std::optional<std::string> enter(std::string_view profileName) override;
  [[nodiscard]] std::optional<std::string> endStart() override;

  // Where a process that has entered the profile can open files by itself; empty where the profile cannot be read, and
  // then not be entered.
  [[nodiscard]] std::vector<std::string> openPaths(std::string_view profileName) const;
  // What the profile asks and this kernel cannot do, known once entered; each ends "this kernel cannot …".
  [[nodiscard]] const std::vector<std::string>& notEnforced() const { return notEnforced_; }
  // Of this process, as the profile and what it was started with allow.
  [[nodiscard]] static uint64_t descriptorLimit();
  // True in builds with a sanitizer.
  [[nodiscard]] static bool staysDumpable();
  // False in builds with a sanitizer, which reserves more address space than there is memory.
  [[nodiscard]] static bool limitsAddressSpace();

 private:
  [[nodiscard]] std::variant<ConfinementProfile, TomlError> read(std::string_view profileName) const;
  const std::string folder_;
  const ProfileVariables variables_;
  SystemCallProfile systemCalls_;
  std::vector<std::string> notEnforced_;
};

}  // namespace kyt
