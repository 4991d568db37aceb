// The local message log: a plain-text trail of what back ends answered. Callers are the message router, the
// flush fan-in and the uploads, on connections' queues and on URL sessions' delegate queues, several at once;
// a call may block for file operations. A failure is the implementation's to log.
#pragma once

#include <cstddef>
#include <cstdint>
#include <initializer_list>

#include "platform/objects/Value.h"

namespace kyt {

class MessageLog {
 public:
  virtual ~MessageLog() = default;
  // Whether a line with a text of at least so many bytes may be written, asked before the text is made. If not, it counts
  // as lost, as if it had been written. May block for file operations.
  [[nodiscard]] virtual bool takesLine(uint32_t user, size_t leastBytes) = 0;
  // One line: every "%@" of the format takes the next object's description. `user`: whose client it is about.
  virtual void writeToLogFile(uint32_t user, const char* format, std::initializer_list<Value> objects) = 0;
};

}  // namespace kyt
