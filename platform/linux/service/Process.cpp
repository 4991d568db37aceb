#include "platform/linux/service/Process.h"

#include <fcntl.h>
#include <malloc.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <system_error>

namespace kyt {

void fillStandardDescriptors() {
  int opened = ::open("/dev/null", O_RDWR);
  while (opened >= 0 && opened <= STDERR_FILENO) opened = ::open("/dev/null", O_RDWR);
  if (opened > STDERR_FILENO) ::close(opened);
}

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

OwnFigures ownFigures() {
  OwnFigures figures;
  figures.pid = ::getpid();
  const int file = ::open("/proc/self/status", O_RDONLY | O_CLOEXEC);
  if (file < 0) return figures;
  char text[4096];
  const ssize_t length = ::read(file, text, sizeof text - 1);
  ::close(file);
  text[length > 0 ? length : 0] = 0;
  const auto number = [&text](const char* key) -> uint64_t {
    const char* line = std::strstr(text, key);
    return line != nullptr ? std::strtoull(line + std::strlen(key), nullptr, 10) : 0;
  };
  figures.residentBytes = number("\nVmRSS:") * 1024;
  figures.anonymousBytes = number("\nRssAnon:") * 1024;
  figures.threads = static_cast<uint32_t>(number("\nThreads:"));
  return figures;
}

void giveLargeBlocksBack() {
  constexpr int kLarge = 512 << 10;
  (void)::mallopt(M_MMAP_THRESHOLD, kLarge);
}

void shareHeaps() {
  constexpr int kHeaps = 4;
  (void)::mallopt(M_ARENA_MAX, kHeaps);
}

void giveFreeMemoryBack() {
  (void)::malloc_trim(0);
}

}  // namespace kyt
