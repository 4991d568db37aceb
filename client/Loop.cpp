#include "client/Loop.h"

#include <algorithm>
#include <mutex>
#include <utility>

namespace kyt::client {

namespace {

using std::chrono::milliseconds;
using Steady = std::chrono::steady_clock;

constexpr milliseconds kLookInterval{1};      // while messages flow
constexpr milliseconds kQuietAfter{20};       // no message for so long: sleep until woken
constexpr milliseconds kUnwokenInterval{20};  // there was no descriptor left for the wake-up

std::atomic<Loop*> currentLoop{nullptr};
std::once_flag forkHandlersInstalled;
thread_local const Loop* threadLoop = nullptr;

}  // namespace

Loop* Loop::current() {
  std::call_once(forkHandlersInstalled, installForkHandlers);
  Loop* loop = currentLoop.load();
  if (loop != nullptr) return loop;
  // Never destroyed: the thread and forked children may need it until the process ends.
  auto* made = new Loop;
  if (currentLoop.compare_exchange_strong(loop, made)) return made;
  delete made;
  return loop;
}

void Loop::installForkHandlers() {
  linux_client::atFork(
      []() NO_THREAD_SAFETY_ANALYSIS {
        if (Loop* loop = currentLoop.load()) loop->mutex_.lock();
      },
      []() NO_THREAD_SAFETY_ANALYSIS {
        if (Loop* loop = currentLoop.load()) loop->mutex_.unlock();
      },
      []() NO_THREAD_SAFETY_ANALYSIS {
        // The parent's connections stay the parent's: this process has none of the threads that would serve
        // them.
        Loop* loop = currentLoop.exchange(nullptr);
        if (loop == nullptr) return;
        for (const auto& session : loop->sessions_) session->becomeInert();
        loop->mutex_.unlock();
      });
}

bool Loop::isCurrentThread() const {
  return threadLoop == this;
}

void Loop::add(const std::shared_ptr<Session>& session) {
  bool ran = false, served = false;
  {
    // Started under the lock: whoever adds meanwhile would rely on a thread that may never come.
    MutexLock lock(mutex_);
    ran = running_;
    served = running_ = ran || linux_client::startThread(
                                   "kytreporting", [](void* loop) { static_cast<Loop*>(loop)->run(); }, this);
    if (served) sessions_.push_back(session);
  }
  if (!served) session->endUnserved();
  if (ran) wakeUp_.wake();
}

void Loop::closeAll() {
  Sessions sessions;
  {
    MutexLock lock(mutex_);
    sessions = sessions_;
  }
  for (const auto& session : sessions) session->stop();
}

void Loop::enroll(const Session& session) {
  MutexLock lock(mutex_);
  counted_.insert(&session);
}

void Loop::retire(const Session& session) {
  MutexLock lock(mutex_);
  counted_.erase(&session);
  addTo(countedBefore_, session.statistics());
}

void Loop::addToTotals(const KYTReporting::Statistics& figures) {
  MutexLock lock(mutex_);
  addTo(countedBefore_, figures);
}

KYTReporting::Statistics Loop::totals() {
  MutexLock lock(mutex_);
  KYTReporting::Statistics sum = countedBefore_;
  for (const Session* session : counted_) addTo(sum, session->statistics());
  return sum;
}

void Loop::noticeWork() {
  std::atomic_thread_fence(std::memory_order_seq_cst);
  if (sleeping_.load(std::memory_order_relaxed) && sleeping_.exchange(false)) wakeUp_.wake();
}

bool Loop::turn(const Sessions& sessions) {
  bool active = false;
  const SteadyTime now = Steady::now();
  for (const auto& session : sessions) active |= session->pump(now);
  return active;
}

bool Loop::anyHasWork(const Sessions& sessions) {
  for (const auto& session : sessions)
    if (session->hasWork()) return true;
  return false;
}

bool Loop::anyIsDone(const Sessions& sessions) {
  for (const auto& session : sessions)
    if (session->isDone()) return true;
  return false;
}

milliseconds Loop::timeout(const Sessions& sessions, bool active) const {
  if (active) return kLookInterval;
  milliseconds timeout{-1};
  const SteadyTime now = Steady::now();
  for (const auto& session : sessions) {
    const auto deadline = session->nextDeadline();
    if (!deadline) continue;
    const auto left = std::max(std::chrono::ceil<milliseconds>(*deadline - now), milliseconds(0));
    if (timeout.count() < 0 || left < timeout) timeout = left;
  }
  if (wakeUp_.fd() < 0 && (timeout.count() < 0 || timeout > kUnwokenInterval)) return kUnwokenInterval;
  return timeout;
}

// Those that go on; with none of them the thread is to end.
Loop::Sessions Loop::sessionsLeft() {
  Sessions ended;  // what they own goes after the lock: that may be the last of it
  MutexLock lock(mutex_);
  std::erase_if(sessions_, [&ended](auto& session) {
    libraryThread.assertCurrent();
    if (session->isDone()) ended.push_back(std::move(session));
    return session == nullptr;
  });
  if (sessions_.empty()) running_ = false;
  return sessions_;
}

void Loop::wait(const Sessions& sessions, bool active, linux_client::WaitSet& waits) {
  waits.clear();
  const size_t wakeIndex = waits.add(wakeUp_.fd(), false);
  std::vector<std::pair<size_t, Session*>> indexes;
  for (const auto& session : sessions)
    if (session->fd() >= 0)
      indexes.emplace_back(waits.add(session->fd(), session->wantsToWrite()), session.get());
  waits.wait(timeout(sessions, active));
  sleeping_.store(false);
  if (waits.ready(wakeIndex)) wakeUp_.clear();
  const SteadyTime now = Steady::now();
  for (const auto& [index, session] : indexes)
    if (waits.ready(index) && session->fd() >= 0) session->readable(now);
}

void Loop::run() {
  threadLoop = this;
  libraryThread.assertCurrent();
  Sessions sessions;
  linux_client::WaitSet waits;
  SteadyTime lastActive = Steady::now();
  for (;;) {
    {
      // Those that end here run completions: without the lock, and before the thread waits.
      const Sessions former = std::exchange(sessions, sessionsLeft());
    }
    if (sessions.empty()) return;
    if (turn(sessions)) lastActive = Steady::now();
    bool active = Steady::now() - lastActive < kQuietAfter;
    if (!active) {
      sleeping_.store(true);
      std::atomic_thread_fence(std::memory_order_seq_cst);
      active = anyHasWork(sessions);  // what was queued before anyone could see that this thread sleeps
    }
    if (!anyIsDone(sessions)) wait(sessions, active, waits);
  }
}

}  // namespace kyt::client
