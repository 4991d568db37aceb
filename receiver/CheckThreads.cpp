#include "receiver/CheckThreads.h"

#include <utility>

#include "platform/linux/base/Threads.h"
#include "receiver/Limits.h"

namespace kyt::receiver {

CheckThreads::CheckThreads(const Clock& clock) : clock_(clock) {
  for (size_t level = 0; level < kLevels; ++level)
    for (unsigned i = 0; i < (level == 0 ? Limits::checkThreads : 1); ++i)
      threads_.at(level).emplace_back([this, level] { run(level); });
}

// Level by level, as one gives the next what is larger.
CheckThreads::~CheckThreads() {
  for (size_t level = 0; level < kLevels; ++level) {
    {
      MutexLock lock(mutex_);
      levels_.at(level).isStopping = true;
      levels_.at(level).changed.notifyAll();
    }
    for (std::thread& thread : threads_.at(level)) thread.join();
  }
}

void CheckThreads::submit(Work work) {
  put(0, {std::move(work), clock_.monotonic()});
}

void CheckThreads::put(size_t level, Waiting waiting) {
  {
    MutexLock lock(mutex_);
    Level& into = levels_.at(level);
    // What is small is bounded by the bodies that the server keeps.
    if (level == 0 || into.bytes + waiting.work.bytes <= Limits::maxWaitingCheckBytes) {
      into.bytes += waiting.work.bytes;
      into.waiting.push_back(std::move(waiting));
      into.changed.notifyOne();
      return;
    }
  }
  waiting.work.refuse();
}

void CheckThreads::look(size_t level, Waiting waiting) {
  if (clock_.monotonic() - waiting.since > Limits::checkTime) return waiting.work.refuse();
  if (!waiting.work.look(Limits::checkSizes.at(level))) put(level + 1, std::move(waiting));
}

void CheckThreads::run(size_t level) {
  beginServiceThread("kyt-check");
  for (;;) {
    Waiting next;
    {
      MutexLock lock(mutex_);
      Level& from = levels_.at(level);
      while (from.waiting.empty() && !from.isStopping) from.changed.wait(mutex_);
      if (from.waiting.empty()) return;
      next = std::move(from.waiting.front());
      from.waiting.pop_front();
      from.bytes -= next.work.bytes;
    }
    look(level, std::move(next));
  }
}

}  // namespace kyt::receiver
