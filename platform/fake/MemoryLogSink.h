// A log sink that keeps every line, for tests that assert what was written. Any thread.
#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "platform/base/Mutex.h"
#include "platform/queues/Log.h"

namespace kyt {

class MemoryLogSink : public LogSink {
 public:
  struct Line {
    LogLevel level;
    std::string line;
    friend bool operator==(const Line&, const Line&) = default;
  };

  void write(LogLevel level, std::string_view line) override;
  // Whether a line has that text in it, and how many have; at any level.
  [[nodiscard]] bool contains(std::string_view text) const { return count(text) != 0; }
  [[nodiscard]] size_t count(std::string_view text) const;
  // … of one level.
  [[nodiscard]] bool contains(LogLevel level, std::string_view text) const { return count(level, text) != 0; }
  [[nodiscard]] size_t count(LogLevel level, std::string_view text) const;
  [[nodiscard]] std::vector<Line> lines() const;
  void clear();

 private:
  mutable Mutex mutex_;
  std::vector<Line> lines_ GUARDED_BY(mutex_);
};

}  // namespace kyt
