// A message log that keeps its lines, formatted. Any thread.
#pragma once

#include <string>
#include <vector>

#include "platform/Log.h"
#include "platform/Mutex.h"
#include "session/MessageLog.h"

namespace kyt {

class RecordingMessageLog final : public MessageLog {
 public:
  void writeToLogFile(const char* format, std::initializer_list<Value> objects) override {
    MutexLock lock(mutex_);
    lines_.push_back(formatObjects(format, objects));
  }
  [[nodiscard]] std::vector<std::string> lines() const {
    MutexLock lock(mutex_);
    return lines_;
  }

 private:
  mutable Mutex mutex_;
  std::vector<std::string> lines_ GUARDED_BY(mutex_);
};

}  // namespace kyt
