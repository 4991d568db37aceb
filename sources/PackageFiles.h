// The files that the system's packages brought, as Debian's package manager lists them. One thread.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

namespace kyt::sources {

class PackageFiles {
 public:
  // `folder` holds the lists (NAME.list, a path in each line). Read at the first question, and again when one has come or
  // gone; of each path it keeps eight bytes.
  explicit PackageFiles(std::string folder) : folder_(std::move(folder)) {}
  // Whether there is any list. Where there is none, nothing is known.
  [[nodiscard]] bool areListed();
  // Whether a package brought a file of that path. /usr/bin and /bin, /usr/lib and /lib, … are one folder: the lists have
  // either.
  [[nodiscard]] bool have(std::string_view path);

 private:
  void read();
  [[nodiscard]] bool haveJust(std::string_view path) const;

  const std::string folder_;
  int64_t changed_ = -1;        // the folder's time of change when it was read, in nanoseconds
  std::vector<size_t> hashes_;  // of the paths, sorted
};

}  // namespace kyt::sources
