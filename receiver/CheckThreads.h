// Threads that open posts, so that a large one keeps none of the server's threads from others' posts. Each post is looked at as
// if it were small; one that turns out to be larger begins anew behind others of its size, with threads of their own. So posts
// that inflate to very much hold up each other alone. Of these a bounded number waits, and none for long: the others are
// refused for now. Any thread may submit.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <thread>
#include <vector>

#include "platform/base/Clock.h"
#include "platform/base/ConditionVariable.h"
#include "platform/base/Mutex.h"

namespace kyt::receiver {

class CheckThreads {
 public:
  struct Work {
    size_t bytes = 0;  // of the body as sent
    // False: once it is opened it has more bytes than that, and nothing was done.
    std::function<bool(uint64_t mostBytes)> look;
    std::function<void()> refuse;
  };
  explicit CheckThreads(const Clock& clock);
  ~CheckThreads();  // does or refuses what was submitted
  CheckThreads(const CheckThreads&) = delete;
  CheckThreads& operator=(const CheckThreads&) = delete;

  // One of the two is called once more or once, the second at once or later.
  void submit(Work work) EXCLUDES(mutex_);

 private:
  struct Waiting {
    Work work;
    MonotonicTime since{};
  };
  struct Level {
    std::deque<Waiting> waiting;
    size_t bytes = 0;  // of the bodies of these
    bool isStopping = false;
    ConditionVariable changed;
  };
  static constexpr size_t kLevels = 3;
  void put(size_t level, Waiting waiting) EXCLUDES(mutex_);
  void run(size_t level) EXCLUDES(mutex_);
  void look(size_t level, Waiting waiting) EXCLUDES(mutex_);

  const Clock& clock_;
  Mutex mutex_;
  std::array<Level, kLevels> levels_ GUARDED_BY(mutex_);
  std::array<std::vector<std::thread>, kLevels> threads_;
};

}  // namespace kyt::receiver
