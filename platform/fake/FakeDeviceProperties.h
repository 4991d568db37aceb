// Device properties as a test sets them. Any thread.
#pragma once

#include <atomic>
#include <functional>
#include <limits>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include "platform/DeviceProperties.h"
#include "platform/base/Mutex.h"

namespace kyt {

class FakeDeviceProperties final : public DeviceProperties {
 public:
  void setProperty(std::string_view key, std::string_view value) EXCLUDES(mutex_) {
    MutexLock lock(mutex_);
    properties_[std::string(key)] = std::string(value);
  }
  void removeProperty(std::string_view key) EXCLUDES(mutex_) {
    MutexLock lock(mutex_);
    properties_.erase(std::string(key));
  }
  void setCountryCode(std::optional<std::string> country) EXCLUDES(mutex_) {
    MutexLock lock(mutex_);
    country_ = std::move(country);
  }
  void setSecondsFromGMT(int64_t seconds) { secondsFromGMT_ = seconds; }
  // From that second on, as where the clocks are put forward.
  void changeSecondsFromGMT(int64_t from, int64_t seconds) {
    later_ = seconds;
    laterFrom_ = from;
  }
  // Called for each question, by the thread that asks, before the answer. Set before anybody asks.
  void setOnQuery(std::function<void(std::string_view key)> onQuery) { onQuery_ = std::move(onQuery); }
  // How often that property was asked for.
  [[nodiscard]] int queries(std::string_view key) const EXCLUDES(mutex_) {
    MutexLock lock(mutex_);
    auto found = queries_.find(std::string(key));
    return found == queries_.end() ? 0 : found->second;
  }

  [[nodiscard]] std::optional<String> property(std::string_view key) override EXCLUDES(mutex_) {
    if (onQuery_) onQuery_(key);
    MutexLock lock(mutex_);
    ++queries_[std::string(key)];
    auto found = properties_.find(std::string(key));
    if (found == properties_.end()) return std::nullopt;
    return String(std::string_view(found->second));
  }
  [[nodiscard]] std::optional<String> countryCode() override EXCLUDES(mutex_) {
    MutexLock lock(mutex_);
    if (!country_) return std::nullopt;
    return String(std::string_view(*country_));
  }
  [[nodiscard]] int64_t secondsFromGMT(TimeValue time) override {
    return time.seconds >= laterFrom_ ? later_ : secondsFromGMT_;
  }

 private:
  mutable Mutex mutex_;
  std::map<std::string, std::string> properties_ GUARDED_BY(mutex_);
  std::map<std::string, int> queries_ GUARDED_BY(mutex_);
  std::optional<std::string> country_ GUARDED_BY(mutex_);
  std::function<void(std::string_view)> onQuery_;
  std::atomic<int64_t> secondsFromGMT_ = 0, later_ = 0;
  std::atomic<int64_t> laterFrom_ = std::numeric_limits<int64_t>::max();
};

}  // namespace kyt
