// Which names of units and programs a report may carry: those that came with the system's packages, since what somebody
// made on the device may be called after a person, a folder or an address. One thread.
#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "sources/PackageFiles.h"

namespace kyt::sources {

// Said of a unit or a program that is not named.
inline constexpr char kLocal[] = "(local)";

class SystemNames {
 public:
  struct Options {
    std::vector<std::string> unitFolders;  // with the units that may be named
    // The packages' lists of files. Where there are none, a place that packages alone should write to stands for a package.
    std::string packages;
    std::string root;  // in front of programs' paths, for tests
  };
  explicit SystemNames(Options options) : options_(std::move(options)), files_(options_.packages) {}

  // The unit's name without what stands between "@" and the ending, if a package brought a file of that name to one of the
  // folders.
  [[nodiscard]] std::string unit(std::string_view unit);
  // The path itself where root owns a file there that a package brought; without lists, where it lies below /usr (but
  // /usr/local), /bin, /sbin, /lib, /lib32 or /lib64.
  [[nodiscard]] std::string program(std::string_view path);

 private:
  const Options options_;
  PackageFiles files_;
};

}  // namespace kyt::sources
