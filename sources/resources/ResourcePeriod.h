// How busy the machine was over a period: lowest, mean and highest value of each figure. One thread.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>

#include "platform/objects/Value.h"

namespace kyt::sources {

class ResourcePeriod {
 public:
  // `root` stands in front of /proc, /sys and /var, for tests.
  explicit ResourcePeriod(std::string root) : root_(std::move(root)) {}
  // Looks at the machine; the time is that of a clock that only goes forward, in microseconds. What the machine does not
  // have is left out. Shares over time (processor, pressure) begin with the second look.
  void sample(uint64_t microseconds);
  // Seconds, number of looks, and "…Min", "…Mean" and "…Max" of each figure.
  [[nodiscard]] Dictionary summary() const;
  // A new period, which begins with the last look of this one.
  void restart();
  [[nodiscard]] bool empty() const { return ranges_.empty(); }

 private:
  struct Range {
    double lowest = 0, highest = 0, sum = 0;
    uint64_t count = 0;
  };
  void note(const std::string& name, double value);
  // Of a sum that grows, such as microseconds stalled: its growth since the last look for each microsecond.
  void noteGrowth(const std::string& name, double sum, double elapsed);
  void processor();
  void memory();
  void disk();
  void pressure(const std::string& resource, const std::string& name, double elapsed);
  void temperature();

  const std::string root_;
  std::map<std::string, Range> ranges_;
  std::map<std::string, double> sums_;
  std::optional<std::pair<double, double>> processorTimes_;  // busy, all
  uint64_t began_ = 0, last_ = 0, looks_ = 0;
};

}  // namespace kyt::sources
