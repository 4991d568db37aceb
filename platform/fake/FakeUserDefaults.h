// User defaults in memory. Tests put values in and may make every write fail. Any thread.
#pragma once

#include <map>
#include <string>
#include <string_view>
#include <utility>

#include "platform/UserDefaults.h"
#include "platform/base/Mutex.h"

namespace kyt {

class FakeUserDefaults final : public UserDefaults {
 public:
  void put(std::string_view domain, std::string_view key, Value value) EXCLUDES(mutex_) {
    MutexLock lock(mutex_);
    values_[{std::string(domain), std::string(key)}] = std::move(value);
  }
  void removeAll() EXCLUDES(mutex_) {
    MutexLock lock(mutex_);
    values_.clear();
  }
  void setFailsWrites(bool fails) EXCLUDES(mutex_) {
    MutexLock lock(mutex_);
    failsWrites_ = fails;
  }
  // How many values were stored by set() and stringOrStore().
  [[nodiscard]] int writes() const EXCLUDES(mutex_) {
    MutexLock lock(mutex_);
    return writes_;
  }
  [[nodiscard]] int reads() const EXCLUDES(mutex_) {
    MutexLock lock(mutex_);
    return reads_;
  }

  [[nodiscard]] Value value(std::string_view domain, std::string_view key) override EXCLUDES(mutex_) {
    MutexLock lock(mutex_);
    ++reads_;
    auto found = values_.find({std::string(domain), std::string(key)});
    return found == values_.end() ? Value() : found->second;
  }
  [[nodiscard]] std::optional<Error> set(std::string_view domain, std::string_view key, Value value) override
      EXCLUDES(mutex_) {
    MutexLock lock(mutex_);
    if (failsWrites_) return Error{"FakeUserDefaults", -1, "writing fails"};
    ++writes_;
    std::pair name{std::string(domain), std::string(key)};
    if (value.isNull()) {
      values_.erase(name);
    } else {
      values_[std::move(name)] = std::move(value);
    }
    return std::nullopt;
  }
  using UserDefaults::stringOrStore;
  [[nodiscard]] String stringOrStore(std::string_view domain, std::string_view key, String value,
                                     std::optional<uint32_t> /*owner*/) override EXCLUDES(mutex_) {
    MutexLock lock(mutex_);
    std::pair name{std::string(domain), std::string(key)};
    auto found = values_.find(name);
    if (found != values_.end() && found->second.string() != nullptr) return *found->second.string();
    if (failsWrites_) return value;
    ++writes_;
    values_[std::move(name)] = Value(value);
    return value;
  }

 private:
  mutable Mutex mutex_;
  std::map<std::pair<std::string, std::string>, Value> values_ GUARDED_BY(mutex_);
  bool failsWrites_ GUARDED_BY(mutex_) = false;
  int writes_ GUARDED_BY(mutex_) = 0;
  int reads_ GUARDED_BY(mutex_) = 0;
};

}  // namespace kyt
