#include "sources/PackageFiles.h"

#include <sys/stat.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <functional>
#include <system_error>

namespace kyt::sources {

bool PackageFiles::areListed() {
  read();
  return !hashes_.empty();
}

bool PackageFiles::have(std::string_view path) {
  read();
  constexpr std::string_view kUsr = "/usr";
  return haveJust(path) || (path.starts_with("/usr/") ? haveJust(path.substr(kUsr.size()))
                                                      : haveJust(std::string(kUsr) + std::string(path)));
}

bool PackageFiles::haveJust(std::string_view path) const {
  return std::binary_search(hashes_.begin(), hashes_.end(), std::hash<std::string_view>()(path));
}

void PackageFiles::read() {
  struct stat status = {};
  constexpr int64_t kNanoseconds = 1'000'000'000;
  const bool isThere = ::stat(folder_.c_str(), &status) == 0;
  const int64_t changed = isThere ? status.st_mtim.tv_sec * kNanoseconds + status.st_mtim.tv_nsec : 0;
  if (changed == changed_) return;
  changed_ = changed;
  hashes_.clear();
  std::error_code error;
  for (std::filesystem::directory_iterator file(folder_, error), end; !error && file != end;
       file.increment(error)) {
    if (file->path().extension() != ".list") continue;
    std::ifstream stream(file->path());
    for (std::string line; std::getline(stream, line);)
      hashes_.push_back(std::hash<std::string_view>()(line));
  }
  std::sort(hashes_.begin(), hashes_.end());
  hashes_.erase(std::unique(hashes_.begin(), hashes_.end()), hashes_.end());  // folders, of many packages
}

}  // namespace kyt::sources
