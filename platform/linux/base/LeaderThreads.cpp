#include "platform/linux/base/LeaderThreads.h"

#include <errno.h>

#include <algorithm>
#include <system_error>
#include <utility>

#include "platform/linux/base/Threads.h"

namespace kyt {

bool LeaderThreads::start() {
  MutexLock lock(mutex_);
  return startThread();
}

bool LeaderThreads::startThread() {
  try {
    handles_.emplace_back([this] { runThread(); });
  } catch (const std::system_error& error) {
    errno = error.code().value();
    return false;
  }
  ++threads_;
  return true;
}

void LeaderThreads::stop() {
  std::thread last;
  {
    MutexLock lock(mutex_);
    stopping_ = true;
    changed_.notifyAll();
    while (threads_ > 0) ended_.wait(mutex_);
    last = std::move(lastEnded_);
  }
  if (last.joinable()) last.join();  // it has joined the one that ended before it, and so on
}

void LeaderThreads::runThread() {
  beginServiceThread(name_.c_str());
  std::thread former;
  mutex_.lock();
  while (!stopping_ && (vacant_ || !standby_)) {
    if (vacant_) {
      vacant_ = false;
      mutex_.unlock();
      lead_();
      mutex_.lock();
    } else {
      standBy();
    }
  }
  const auto own = std::find_if(handles_.begin(), handles_.end(), [](const std::thread& handle) {
    return handle.get_id() == std::this_thread::get_id();
  });
  former = std::exchange(lastEnded_, std::move(*own));
  handles_.erase(own);
  if (--threads_ == 0) ended_.notifyAll();
  mutex_.unlock();
  if (former.joinable()) former.join();
}

// Until the lead is vacant, or taken away from one who is busy with the same work at two ticks.
void LeaderThreads::standBy() {
  standby_ = true;
  uint64_t lastAside = 0;
  uint64_t lastBegun = 0;
  while (!vacant_ && !stopping_) {
    if (!watched_) {
      changed_.wait(mutex_);
      continue;
    }
    changed_.waitUntil(mutex_, std::chrono::steady_clock::now() + kTick);
    uint64_t aside = aside_.load();
    const uint64_t begun = begun_.load();
    if (aside != 0 && aside == lastAside) {
      if (aside_.compare_exchange_strong(aside, 0)) vacant_ = true;  // its endAside() will find out
    } else if (aside == 0 && begun == lastBegun) {
      watched_ = false;
      if (aside_.load() != 0) watched_ = true;  // beginAside() may have seen the old value
    }
    lastAside = aside;
    lastBegun = begun;
  }
  standby_ = false;
  watched_ = false;
}

bool LeaderThreads::mayRunAside(MonotonicTime now) {
  if (watched_.load()) return true;
  if (now - windowBegin_ > kWindow) {
    windowBegin_ = now;
    inWindow_ = 0;
  }
  if (++inWindow_ < kOften) return false;
  inWindow_ = 0;
  MutexLock lock(mutex_);
  if (standby_) {
    watched_ = true;
    changed_.notifyAll();
  } else if (threads_ < kMostThreads && !stopping_) {
    (void)startThread();  // it stands by when this is asked next; without it nothing is run aside
  }
  return standby_;
}

uint64_t LeaderThreads::beginAside() {
  const uint64_t number = begun_.load(std::memory_order_relaxed) + 1;
  begun_.store(number, std::memory_order_relaxed);
  aside_.store(number);
  if (!watched_.load()) {
    MutexLock lock(mutex_);
    watched_ = standby_;
    changed_.notifyAll();
  }
  return number;
}

bool LeaderThreads::endAside(uint64_t number) {
  return aside_.compare_exchange_strong(number, 0);
}

void LeaderThreads::giveLeadAway(uint64_t number) {
  if (!aside_.compare_exchange_strong(number, 0)) return;  // taken away already
  MutexLock lock(mutex_);
  vacant_ = true;
  changed_.notifyAll();
}

unsigned LeaderThreads::threads() {
  MutexLock lock(mutex_);
  return threads_;
}

}  // namespace kyt
