#include "sources/Names.h"

#include <sys/stat.h>

#include <algorithm>

namespace kyt::sources {

namespace {

constexpr size_t kLongestName = 255;  // of a unit, as systemd allows

bool isPlain(std::string_view text) {
  return std::all_of(text.begin(), text.end(), [](char c) { return c > ' ' && c < 0x7f; });
}

bool isFile(const std::string& path, struct stat& status) {
  return ::stat(path.c_str(), &status) == 0 && S_ISREG(status.st_mode);
}

// Without lists. Nobody can say who wrote below /opt.
bool isSystemsPlace(std::string_view path) {
  const auto below = [&](std::string_view folder) { return path.starts_with(folder); };
  return (below("/usr/") && !below("/usr/local/")) || below("/bin/") || below("/sbin/") || below("/lib/") ||
         below("/lib32/") || below("/lib64/");
}

}  // namespace

std::string SystemNames::unit(std::string_view unit) {
  std::string name(unit);
  const size_t at = name.find('@'), dot = name.rfind('.');
  if (at != std::string::npos && dot != std::string::npos && at < dot) name.erase(at + 1, dot - at - 1);
  if (name.empty() || name.size() > kLongestName || name.find('/') != std::string::npos || !isPlain(name))
    return kLocal;
  for (const std::string& folder : options_.unitFolders) {
    struct stat status = {};
    const std::string file = folder + "/" + name;
    if (isFile(file, status) && (!files_.areListed() || files_.have(file))) return name;
  }
  return kLocal;
}

std::string SystemNames::program(std::string_view path) {
  if (path.empty() || path.find("/..") != std::string_view::npos || path.size() > kLongestName ||
      !isPlain(path))
    return kLocal;
  struct stat status = {};
  if (!isFile(options_.root + std::string(path), status) || status.st_uid != 0) return kLocal;
  const bool isBrought = files_.areListed() ? files_.have(path) : isSystemsPlace(path);
  return isBrought ? std::string(path) : kLocal;
}

}  // namespace kyt::sources
