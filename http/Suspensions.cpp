#include "http/Suspensions.h"

#include <pthread.h>

#include <algorithm>

namespace kyt::http {
namespace {

constexpr std::chrono::seconds kTick(5);

}  // namespace

Suspensions::Suspensions(std::function<void()> tick) : tick_(std::move(tick)), thread_([this] { run(); }) {}

Suspensions::~Suspensions() {
  stop();
  thread_.join();
}

uint64_t Suspensions::generation() {
  MutexLock lock(mutex_);
  return generation_;
}

bool Suspensions::suspend(MHD_Connection* connection, const Wait& wait, uint64_t generation) {
  MutexLock lock(mutex_);
  if (stopped_ || generation != generation_) return false;
  MHD_suspend_connection(connection);
  waiting_.emplace(wait.deadline, Waiting{connection, wait.what});
  changed_.notify_all();
  return true;
}

void Suspensions::wake(WaitFor what) {
  MutexLock lock(mutex_);
  ++generation_;
  std::erase_if(waiting_, [&](const auto& entry) {
    if (what == WaitFor::data && entry.second.what != WaitFor::data) return false;
    MHD_resume_connection(entry.second.connection);
    return true;
  });
}

void Suspensions::stop() {
  MutexLock lock(mutex_);
  stopped_ = true;
  for (const auto& [deadline, waiting] : waiting_) MHD_resume_connection(waiting.connection);
  waiting_.clear();
  changed_.notify_all();
}

bool Suspensions::stopped() {
  MutexLock lock(mutex_);
  return stopped_;
}

void Suspensions::run() {
  pthread_setname_np(pthread_self(), "kyt-deadlines");
  SteadyTime nextTick = std::chrono::steady_clock::now() + kTick;
  for (;;) {
    bool tickNow = false;
    {
      MutexLock lock(mutex_);
      if (stopped_) return;
      const SteadyTime next = waiting_.empty() ? nextTick : std::min(nextTick, waiting_.begin()->first);
      changed_.wait_until(mutex_, next);
      const SteadyTime now = std::chrono::steady_clock::now();
      while (!waiting_.empty() && waiting_.begin()->first <= now) {
        MHD_resume_connection(waiting_.begin()->second.connection);
        waiting_.erase(waiting_.begin());
      }
      tickNow = now >= nextTick;
      if (tickNow) nextTick = now + kTick;
    }
    if (tickNow) tick_();
  }
}

}  // namespace kyt::http
