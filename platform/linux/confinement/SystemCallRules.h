// One entry of a list of system calls in a confinement profile, as text and as the comparisons that it stands
// for. The grammar is small, so that a profile reads as a list of what a program may ask of the kernel:
//
//   read                              the call, whatever its arguments
//   451..511                          calls by number, if they are younger than the libraries here
//   socket(AF_UNIX, only SOCK_DGRAM|SOCK_CLOEXEC)
//                                     the call with such arguments; those past the last one are free
//
// An argument is `*` (anything), a value, `NULL`, `SELF` (this process's number), `only A|B` (no bits but
// these), `has A|B` (all of these), `no A|B` (none of these) or `has A|B no C|D`. A value is a number or one of
// the kernel's constants; the table in the source has what makes sense in a profile. Pointers cannot be
// followed, so names of files and addresses of sockets are Landlock's part.
//
// Used by the profile's parser; the filter itself is SystemCallFilter.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

namespace kyt {

// (argument & mask) == value
struct ArgumentCondition {
  unsigned argument = 0;  // from 0
  uint64_t mask = 0, value = 0;
  bool operator==(const ArgumentCondition&) const = default;
};

struct SystemCallRule {
  std::string call;                                // as written, without arguments
  std::vector<int> numbers;                        // empty: this architecture has no such call
  std::vector<ArgumentCondition> conditions = {};  // all of them must hold
};

// What is wrong, as the end of a sentence that begins with the entry ("has an unknown call").
[[nodiscard]] std::variant<SystemCallRule, std::string> parseSystemCallRule(std::string_view entry);

// "EPERM" and the like; 0 for what a refusal cannot be.
[[nodiscard]] int errorNumber(std::string_view name);

}  // namespace kyt
