#include "platform/linux/system/Process.h"

#include <malloc.h>
#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <system_error>

namespace kyt {

std::string executableFolder() {
  std::error_code error;
  const auto program = std::filesystem::read_symlink("/proc/self/exe", error);
  return error ? std::string() : program.parent_path().string();
}

std::string absolutePath(const std::string& path) {
  if (path.empty()) return path;
  std::error_code error;
  auto absolute = std::filesystem::absolute(path, error).lexically_normal().string();
  if (error) return path;
  while (absolute.size() > 1 && absolute.back() == '/') absolute.pop_back();
  return absolute;
}

std::string folderOf(const std::string& path) {
  return std::filesystem::path(path).parent_path().string();
}

uint32_t currentUser() {
  return ::geteuid();
}

uint64_t raiseDescriptorLimit() {
  constexpr rlim_t most =
      1 << 20;  // where the hard limit is none at all, tables of that size would be too large
  rlimit limit = {};
  if (::getrlimit(RLIMIT_NOFILE, &limit) != 0) return 0;
  limit.rlim_cur = std::max(limit.rlim_cur, std::min(limit.rlim_max, most));
  return ::setrlimit(RLIMIT_NOFILE, &limit) == 0 ? limit.rlim_cur : 0;
}

void giveLargeBlocksBack() {
  constexpr int kLarge = 512 << 10;
  (void)::mallopt(M_MMAP_THRESHOLD, kLarge);
}

}  // namespace kyt
