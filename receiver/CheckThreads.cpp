#include "receiver/CheckThreads.h"

#include <utility>

#include "platform/linux/base/Threads.h"

namespace kyt::receiver {

CheckThreads::CheckThreads(unsigned count) {
  for (unsigned i = 0; i < count; ++i) threads_.emplace_back([this] { run(); });
}

CheckThreads::~CheckThreads() {
  {
    MutexLock lock(mutex_);
    isStopping_ = true;
    changed_.notifyAll();
  }
  for (std::thread& thread : threads_) thread.join();
}

void CheckThreads::submit(std::function<void()> work) {
  MutexLock lock(mutex_);
  work_.push_back(std::move(work));
  changed_.notifyOne();
}

void CheckThreads::run() {
  beginServiceThread("kyt-check");
  for (;;) {
    std::function<void()> work;
    {
      MutexLock lock(mutex_);
      while (work_.empty() && !isStopping_) changed_.wait(mutex_);
      if (work_.empty()) return;
      work = std::move(work_.front());
      work_.pop_front();
    }
    work();
  }
}

}  // namespace kyt::receiver
