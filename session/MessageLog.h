// The local message log: a plain-text trail of what back ends answered. Callers are the message router, the
// flush fan-in and the uploads, on connections' queues and on URL sessions' delegate queues, several at once;
// a call may block for file operations. A failure is the implementation's to log.
#pragma once

#include <initializer_list>

#include "platform/Value.h"

namespace kyt {

class MessageLog {
 public:
  virtual ~MessageLog() = default;
  // One line: every "%@" of the format takes the next object's description.
  virtual void writeToLogFile(const char* format, std::initializer_list<Value> objects) = 0;
};

// Keeps nothing: log files are not kept yet.
class DisabledMessageLog final : public MessageLog {
 public:
  void writeToLogFile(const char*, std::initializer_list<Value>) override {}
};

}  // namespace kyt
