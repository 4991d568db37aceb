#include "platform/linux/data/LinuxMemoryInfo.h"

#include <fcntl.h>
#include <malloc.h>
#include <unistd.h>

#include <charconv>
#include <string_view>

namespace kyt {

size_t LinuxMemoryInfo::blockSize(const void* block) {
  return malloc_usable_size(const_cast<void*>(block));  // reads only
}

uint64_t LinuxMemoryInfo::internalMemory() {
  const int file = open("/proc/self/status", O_RDONLY | O_CLOEXEC);
  if (file < 0) return 0;
  char buffer[8192];
  const ssize_t size = read(file, buffer, sizeof buffer);
  close(file);
  if (size <= 0) return 0;
  const std::string_view text(buffer, static_cast<size_t>(size));
  constexpr std::string_view kName = "RssAnon:";
  const size_t line = text.find(kName);
  if (line == text.npos) return 0;
  const size_t digits = text.find_first_not_of(" \t", line + kName.size());
  if (digits == text.npos) return 0;
  uint64_t kibibytes = 0;
  std::from_chars(text.data() + digits, text.data() + text.size(), kibibytes);
  return kibibytes * 1024;
}

}  // namespace kyt
