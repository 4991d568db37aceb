#include "platform/fake/MemoryLogSink.h"

#include <algorithm>

namespace kyt {

void MemoryLogSink::write(LogLevel level, std::string_view line) {
  MutexLock lock(mutex_);
  lines_.push_back({level, std::string(line)});
}

size_t MemoryLogSink::count(std::string_view text) const {
  const std::vector<Line> all = lines();
  return static_cast<size_t>(std::count_if(all.begin(), all.end(), [text](const Line& line) {
    return line.line.find(text) != std::string::npos;
  }));
}

size_t MemoryLogSink::count(LogLevel level, std::string_view text) const {
  const std::vector<Line> all = lines();
  return static_cast<size_t>(std::count_if(all.begin(), all.end(), [level, text](const Line& line) {
    return line.level == level && line.line.find(text) != std::string::npos;
  }));
}

std::vector<MemoryLogSink::Line> MemoryLogSink::lines() const {
  MutexLock lock(mutex_);
  return lines_;
}

void MemoryLogSink::clear() {
  MutexLock lock(mutex_);
  lines_.clear();
}

}  // namespace kyt
