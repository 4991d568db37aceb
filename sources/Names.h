// Which names of units and programs a report may carry: those that came with the system's packages, since what somebody
// made on the device may be called after a person, a folder or an address. Any thread.
#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace kyt::sources {

// Said of a unit or a program that is not named.
inline constexpr char kLocal[] = "(local)";

// The unit's name without what stands between "@" and the ending, if a file of that name lies in one of the folders.
[[nodiscard]] std::string reportedUnit(std::string_view unit, const std::vector<std::string>& folders);
// The path itself where it lies below /usr (but /usr/local), /bin, /sbin, /lib or /opt and root owns a file there.
// `root` stands in front of it, for tests.
[[nodiscard]] std::string reportedProgram(std::string_view path, const std::string& root = {});

}  // namespace kyt::sources
