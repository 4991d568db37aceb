// The profile of a confinement: what a process may do once it is confined, in one TOML file that people can
// read. LinuxConfinement enters it.
//
//   read, write, folders, sockets
//                            folders and files; entries are absolute paths, or begin with a variable
//                            ("${STATE}/…"), whose values the composition root knows
//   [limits]                 address_space (bytes), descriptors, core (bytes); one that is missing stays as it is
//   [system_calls]           otherwise: the error of a call that no list names, or "kill"
//                            allow, until_listening, kill: lists of rules (SystemCallRules.h)
//   [system_calls.errors]    lists of calls by the name of the error that they fail with instead
//
// The system calls must be there, and no call may be named by two lists.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "platform/linux/confinement/SystemCallFilter.h"
#include "platform/linux/toml/Toml.h"

namespace kyt {

struct ResourceLimits {
  std::optional<uint64_t> addressSpace, descriptors, core;
};

struct ConfinementProfile {
  std::vector<std::string> read, write, folders, sockets;
  ResourceLimits limits;
  SystemCallProfile systemCalls;
};

using ProfileVariables = std::map<std::string, std::string, std::less<>>;

// An error for unknown keys, variables and calls, wrong types, relative paths and missing system calls. An
// entry whose variable has an empty value is left out.
[[nodiscard]] std::variant<ConfinementProfile, TomlError> parseProfile(std::string_view text,
                                                                       std::string_view name,
                                                                       const ProfileVariables& variables);

}  // namespace kyt
