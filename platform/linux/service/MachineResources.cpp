#include "platform/linux/service/MachineResources.h"

#include <sys/resource.h>
#include <sys/sysinfo.h>

#include <algorithm>
#include <charconv>
#include <limits>
#include <string_view>
#include <variant>

#include "platform/linux/files/Files.h"

namespace kyt {
namespace {

constexpr size_t kMostBytes = 65536;
constexpr uint64_t kNoLimit = std::numeric_limits<uint64_t>::max();
constexpr uint64_t kPart = 4;

std::string textOf(const std::string& path) {
  auto read = readRegularFile(path, kMostBytes);
  const auto* contents = std::get_if<FileContents>(&read);
  return contents != nullptr ? contents->bytes : std::string();
}

uint64_t machineMemory() {
  struct sysinfo info = {};
  return ::sysinfo(&info) == 0 ? uint64_t{info.totalram} * info.mem_unit : kNoLimit;
}

uint64_t addressSpaceLimit() {
  rlimit now = {};
  return ::getrlimit(RLIMIT_AS, &now) == 0 && now.rlim_cur != RLIM_INFINITY ? now.rlim_cur : kNoLimit;
}

// "max" is none.
uint64_t numberIn(std::string_view text) {
  uint64_t number = kNoLimit;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
  return error == std::errc() ? number : kNoLimit;
}

// The least limit of the process's group and those around it, of the second version's hierarchy ("0::/a/b").
uint64_t groupLimit(const MachineSources& sources) {
  const std::string groups = textOf(sources.processFolder + "/cgroup");
  const size_t begin = groups.find("0::/");
  if (begin == std::string::npos || (begin != 0 && groups[begin - 1] != '\n')) return kNoLimit;
  std::string group = groups.substr(begin + 3, groups.find('\n', begin) - begin - 3);
  if (group.find("..") != std::string::npos) return kNoLimit;  // outside of this namespace
  uint64_t least = kNoLimit;
  while (true) {
    least = std::min(least, numberIn(textOf(sources.controlGroups + group + "/memory.max")));
    const size_t slash = group.rfind('/');
    if (slash == std::string::npos) return least;
    group.resize(slash);
  }
}

}  // namespace

uint64_t memoryForTheDaemon(const MachineSources& sources) {
  const uint64_t memory = sources.memory != 0 ? sources.memory : machineMemory();
  const uint64_t addresses = sources.addressSpace != 0 ? sources.addressSpace : addressSpaceLimit();
  return std::min({memory / kPart, groupLimit(sources), addresses / kPart});
}

}  // namespace kyt
