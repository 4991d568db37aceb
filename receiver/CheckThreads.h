// Threads that open posts, so that a large one keeps none of the server's threads from others' posts. Any thread may submit;
// what is submitted is bounded by the bodies that the server keeps.
#pragma once

#include <deque>
#include <functional>
#include <thread>
#include <vector>

#include "platform/base/ConditionVariable.h"
#include "platform/base/Mutex.h"

namespace kyt::receiver {

class CheckThreads {
 public:
  explicit CheckThreads(unsigned count);
  ~CheckThreads();  // does what was submitted
  CheckThreads(const CheckThreads&) = delete;
  CheckThreads& operator=(const CheckThreads&) = delete;

  void submit(std::function<void()> work) EXCLUDES(mutex_);

 private:
  void run() EXCLUDES(mutex_);

  Mutex mutex_;
  ConditionVariable changed_;
  std::deque<std::function<void()>> work_ GUARDED_BY(mutex_);
  bool isStopping_ GUARDED_BY(mutex_) = false;
  std::vector<std::thread> threads_;
};

}  // namespace kyt::receiver
