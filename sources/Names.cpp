#include "sources/Names.h"

#include <sys/stat.h>

#include <algorithm>

namespace kyt::sources {

namespace {

constexpr size_t kLongestName = 255;  // of a unit, as systemd allows

bool isPlain(std::string_view text) {
  return std::all_of(text.begin(), text.end(), [](char c) { return c > ' ' && c < 0x7f; });
}

}  // namespace

std::string reportedUnit(std::string_view unit, const std::vector<std::string>& folders) {
  std::string name(unit);
  const size_t at = name.find('@'), dot = name.rfind('.');
  if (at != std::string::npos && dot != std::string::npos && at < dot) name.erase(at + 1, dot - at - 1);
  if (name.empty() || name.size() > kLongestName || name.find('/') != std::string::npos || !isPlain(name))
    return kLocal;
  for (const std::string& folder : folders) {
    struct stat status = {};
    if (::stat((folder + "/" + name).c_str(), &status) == 0 && S_ISREG(status.st_mode)) return name;
  }
  return kLocal;
}

std::string reportedProgram(std::string_view path, const std::string& root) {
  const auto below = [&](std::string_view folder) { return path.starts_with(folder); };
  const bool isSystems = (below("/usr/") && !below("/usr/local/")) || below("/bin/") || below("/sbin/") ||
                         below("/lib/") || below("/lib32/") || below("/lib64/") || below("/opt/");
  if (!isSystems || path.find("/..") != std::string_view::npos || path.size() > kLongestName ||
      !isPlain(path))
    return kLocal;
  struct stat status = {};
  const std::string file = root + std::string(path);
  if (::stat(file.c_str(), &status) != 0 || !S_ISREG(status.st_mode) || status.st_uid != 0) return kLocal;
  return std::string(path);
}

}  // namespace kyt::sources
