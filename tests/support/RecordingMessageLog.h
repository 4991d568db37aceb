// A message log that keeps its lines, formatted. Any thread.
#pragma once

#include <string>
#include <vector>

#include "platform/base/Mutex.h"
#include "platform/objects/Description.h"
#include "platform/queues/Log.h"
#include "session/MessageLog.h"

namespace kyt {

class RecordingMessageLog final : public MessageLog {
 public:
  bool takesLine(uint32_t /*user*/, size_t leastBytes) override {
    MutexLock lock(mutex_);
    asked_.push_back(leastBytes);
    return !full_;
  }
  // From now on it takes no line that it is asked for.
  void setFull(bool full) {
    MutexLock lock(mutex_);
    full_ = full;
  }
  // The sizes that takesLine() was asked for.
  [[nodiscard]] std::vector<size_t> asked() const {
    MutexLock lock(mutex_);
    return asked_;
  }
  void writeToLogFile(uint32_t user, const char* format, std::initializer_list<Value> objects) override {
    MutexLock lock(mutex_);
    lines_.push_back(formatObjects(format, objects));
    users_.push_back(user);
  }
  // Of each line.
  [[nodiscard]] std::vector<uint32_t> users() const {
    MutexLock lock(mutex_);
    return users_;
  }
  [[nodiscard]] std::vector<std::string> lines() const {
    MutexLock lock(mutex_);
    return lines_;
  }

 private:
  mutable Mutex mutex_;
  std::vector<std::string> lines_ GUARDED_BY(mutex_);
  std::vector<uint32_t> users_ GUARDED_BY(mutex_);
  std::vector<size_t> asked_ GUARDED_BY(mutex_);
  bool full_ GUARDED_BY(mutex_) = false;
};

}  // namespace kyt
