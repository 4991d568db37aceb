// The program's threads that wait for a session: for the answer to its goodbye, and for its end. Any thread. Whoever tells
// never waits.
#pragma once

#include <chrono>

#include "platform/base/ConditionVariable.h"
#include "platform/base/Mutex.h"

namespace kyt::client {

class Waiters {
 public:
  // A goodbye was answered, or failed. A second one that fails takes nothing back.
  void goodbyeAnswered(bool success) EXCLUDES(mutex_);
  // Nothing runs for the session any more; no goodbye is answered from now on.
  void sessionEnded() EXCLUDES(mutex_);

  // Waits at most so long; whether a goodbye was answered with success.
  [[nodiscard]] bool waitForGoodbye(std::chrono::milliseconds timeout) EXCLUDES(mutex_);
  void waitForEnd() EXCLUDES(mutex_);

 private:
  Mutex mutex_;
  ConditionVariable changed_;
  bool finished_ GUARDED_BY(mutex_) = false;     // a goodbye was answered with success
  bool goodbyeOver_ GUARDED_BY(mutex_) = false;  // answered or failed
  bool ended_ GUARDED_BY(mutex_) = false;
};

}  // namespace kyt::client
