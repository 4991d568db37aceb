#include "sources/resources/ResourcePeriod.h"

#include <sys/statvfs.h>

#include <algorithm>
#include <cmath>
#include <filesystem>
#include <fstream>
#include <sstream>

namespace kyt::sources {

namespace {

// A thousandth is what such a figure is good for.
double rounded(double value) {
  return std::round(value * 1000) / 1000;
}

}  // namespace

void ResourcePeriod::sample(uint64_t microseconds) {
  const double elapsed = last_ == 0 ? 0 : static_cast<double>(microseconds - last_);
  if (began_ == 0) began_ = microseconds;
  last_ = microseconds;
  ++looks_;
  processor();
  memory();
  disk();
  pressure("cpu", "processorPressure", elapsed);
  pressure("memory", "memoryPressure", elapsed);
  pressure("io", "diskPressure", elapsed);
  temperature();
}

void ResourcePeriod::note(const std::string& name, double value) {
  Range& range = ranges_[name];
  range.lowest = range.count == 0 ? value : std::min(range.lowest, value);
  range.highest = range.count == 0 ? value : std::max(range.highest, value);
  range.sum += value;
  ++range.count;
}

void ResourcePeriod::noteGrowth(const std::string& name, double sum, double elapsed) {
  const auto before = sums_.find(name);
  if (before != sums_.end() && elapsed > 0 && sum >= before->second)
    note(name, std::min(1.0, (sum - before->second) / elapsed));
  sums_[name] = sum;
}

// user nice system idle iowait irq softirq steal: of these, idle and iowait are no work.
void ResourcePeriod::processor() {
  std::ifstream file(root_ + "/proc/stat");
  std::string word;
  if (!(file >> word) || word != "cpu") return;
  double all = 0, idle = 0, ticks = 0;
  for (int column = 0; column < 8 && file >> ticks; ++column) {
    all += ticks;
    if (column == 3 || column == 4) idle += ticks;
  }
  const double busy = all - idle;
  if (processorTimes_ && all > processorTimes_->second)
    note("processor",
         std::clamp((busy - processorTimes_->first) / (all - processorTimes_->second), 0.0, 1.0));
  processorTimes_ = {busy, all};
}

void ResourcePeriod::memory() {
  std::ifstream file(root_ + "/proc/meminfo");
  double total = 0, available = -1;
  for (std::string line; std::getline(file, line);) {
    std::istringstream text(line);
    std::string name;
    double kibibytes = 0;
    if (!(text >> name >> kibibytes)) continue;
    if (name == "MemTotal:") total = kibibytes;
    if (name == "MemAvailable:") available = kibibytes;
  }
  if (total > 0 && available >= 0) note("memory", std::clamp(1 - available / total, 0.0, 1.0));
}

void ResourcePeriod::disk() {
  struct statvfs status = {};
  if (::statvfs((root_ + "/var").c_str(), &status) != 0 || status.f_blocks == 0) return;
  note("disk", 1 - static_cast<double>(status.f_bavail) / static_cast<double>(status.f_blocks));
}

// "some avg10=0.00 avg60=0.00 avg300=0.00 total=12345"
void ResourcePeriod::pressure(const std::string& resource, const std::string& name, double elapsed) {
  std::ifstream file(root_ + "/proc/pressure/" + resource);
  std::string line;
  if (!std::getline(file, line) || !line.starts_with("some ")) return;
  const size_t at = line.find("total=");
  double total = 0;
  if (at != std::string::npos && std::istringstream(line.substr(at + 6)) >> total)
    noteGrowth(name, total, elapsed);
}

void ResourcePeriod::temperature() {
  constexpr double kLowest = -60, kHighest = 200;  // what is outside is a sensor that is not there
  std::optional<double> hottest;
  std::error_code error;
  for (const auto& zone : std::filesystem::directory_iterator(root_ + "/sys/class/thermal", error)) {
    double thousandths = 0;
    if (!zone.path().filename().string().starts_with("thermal_zone")) continue;
    if (std::ifstream file(zone.path() / "temp"); !(file >> thousandths)) continue;
    const double degrees = thousandths / 1000;
    if (degrees > kLowest && degrees < kHighest) hottest = std::max(hottest.value_or(degrees), degrees);
  }
  if (hottest) note("temperature", *hottest);
}

Dictionary ResourcePeriod::summary() const {
  Dictionary fields{{"seconds", static_cast<int64_t>((last_ - began_) / 1'000'000)}, {"looks", looks_}};
  for (const auto& [name, range] : ranges_) {
    fields.set(name + "Min", rounded(range.lowest));
    fields.set(name + "Mean", rounded(range.sum / static_cast<double>(range.count)));
    fields.set(name + "Max", rounded(range.highest));
  }
  return fields;
}

void ResourcePeriod::restart() {
  ranges_.clear();
  began_ = last_;
  looks_ = 0;
}

}  // namespace kyt::sources
