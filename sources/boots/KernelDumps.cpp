#include "sources/boots/KernelDumps.h"

#include <chrono>
#include <filesystem>
#include <fstream>
#include <system_error>

namespace kyt::sources {

namespace {

bool saysPanic(const std::filesystem::path& file) {
  std::ifstream stream(file);
  std::string word;
  return static_cast<bool>(std::getline(stream, word, '#')) && word == "Panic";
}

uint64_t timeOf(const std::filesystem::directory_entry& file) {
  std::error_code error;
  const auto time = file.last_write_time(error);
  if (error) return 0;
  const auto since = std::chrono::file_clock::to_sys(time).time_since_epoch();
  const auto microseconds = std::chrono::duration_cast<std::chrono::microseconds>(since).count();
  return microseconds > 0 ? static_cast<uint64_t>(microseconds) : 0;
}

std::vector<uint64_t> panicsBelow(const std::string& folder) {
  std::vector<uint64_t> times;
  size_t dumps = 0;
  std::error_code error;
  const auto options = std::filesystem::directory_options::skip_permission_denied;
  for (std::filesystem::recursive_directory_iterator file(folder, options, error), end; !error && file != end;
       file.increment(error)) {
    std::error_code none;
    if (!file->path().filename().string().starts_with("dmesg-") || !file->is_regular_file(none)) continue;
    if (++dumps > kMostDumps) break;
    if (saysPanic(file->path())) times.push_back(timeOf(*file));
  }
  return times;
}

}  // namespace

PanicDumps panicDumps(const std::string& root) {
  return {panicsBelow(root + "/sys/fs/pstore"), panicsBelow(root + "/var/lib/systemd/pstore")};
}

}  // namespace kyt::sources
