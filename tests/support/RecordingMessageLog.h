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
};

}  // namespace kyt
