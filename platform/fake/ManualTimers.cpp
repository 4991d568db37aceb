#include "platform/fake/ManualTimers.h"

#include <algorithm>
#include <atomic>
#include <map>
#include <utility>

#include "platform/queues/SerialQueue.h"

namespace kyt {

namespace {

// Periodic work is shared between the handle and what waits in the queue, and runs only while the handle
// lives. A tick that finds the one before it still waiting is missed.
struct Work {
  explicit Work(Task what) : task(std::move(what)) {}
  Task task;
  std::atomic<bool> waiting{false};
};

}  // namespace

struct ManualTimers::Shared {
  using Key = std::pair<MonotonicTime, uint64_t>;  // due time, then order of arming
  struct Armed {
    Duration period;  // zero: once
    std::shared_ptr<SerialQueue> queue;
    std::shared_ptr<Work> work;
    uint64_t id;
  };
  Mutex mutex;
  std::map<Key, Armed> armed GUARDED_BY(mutex);
  uint64_t next GUARDED_BY(mutex) = 0;
};

class ManualTimers::Entry final : public TimerHandle::State {
 public:
  Entry(std::shared_ptr<Shared> shared, uint64_t id) : shared_(std::move(shared)), id_(id) {}
  void cancel() override {
    Shared::Armed dropped;  // its work is destroyed without the lock
    MutexLock lock(shared_->mutex);
    const auto found = std::find_if(shared_->armed.begin(), shared_->armed.end(),
                                    [this](const auto& entry) { return entry.second.id == id_; });
    if (found == shared_->armed.end()) return;
    dropped = std::move(found->second);
    shared_->armed.erase(found);
  }

 private:
  std::shared_ptr<Shared> shared_;
  uint64_t id_;
};

ManualTimers::ManualTimers(ManualClock& clock) : clock_(clock), shared_(std::make_shared<Shared>()) {}

ManualTimers::~ManualTimers() {
  std::map<Shared::Key, Shared::Armed> dropped;
  MutexLock lock(shared_->mutex);
  dropped.swap(shared_->armed);
}

TimerHandle ManualTimers::after(Duration delay, std::shared_ptr<SerialQueue> queue, Task work) {
  return arm(std::max(delay, Duration::zero()), Duration::zero(), std::move(queue), std::move(work));
}

TimerHandle ManualTimers::every(Duration period, Duration mostLate, std::shared_ptr<SerialQueue> queue,
                                Task work) {
  leeway = mostLate;
  period = std::max<Duration>(period, std::chrono::milliseconds(1));
  return arm(period, period, std::move(queue), std::move(work));
}

TimerHandle ManualTimers::arm(Duration delay, Duration period, std::shared_ptr<SerialQueue> queue,
                              Task work) {
  if (refuses) {
    queues.push_back(queue);
    return {};
  }
  auto shared = std::make_shared<Work>(std::move(work));
  const MonotonicTime due = clock_.monotonic() + delay;
  MutexLock lock(shared_->mutex);
  const uint64_t id = shared_->next++;
  shared_->armed.emplace(Shared::Key{due, id},
                         Shared::Armed{period, std::move(queue), std::move(shared), id});
  return TimerHandle(std::make_shared<Entry>(shared_, id));
}

void ManualTimers::advance(Duration duration) {
  advance(duration, [] {});
}

void ManualTimers::advance(Duration duration, Task afterEach) {
  const MonotonicTime end = clock_.monotonic() + duration;
  for (;;) {
    std::shared_ptr<SerialQueue> queue;
    std::shared_ptr<Work> work;
    MonotonicTime due;
    {
      MutexLock lock(shared_->mutex);
      const auto first = shared_->armed.begin();
      if (first == shared_->armed.end() || first->first.first > end) break;
      due = first->first.first;
      Shared::Armed armed = std::move(first->second);
      shared_->armed.erase(first);
      queue = armed.queue;
      work = armed.work;
      if (armed.period > Duration::zero())
        shared_->armed.emplace(Shared::Key{due + armed.period, shared_->next++}, std::move(armed));
    }
    const MonotonicTime now = clock_.monotonic();
    if (due > now) clock_.advance(due - now);
    if (!work->waiting.exchange(true)) {
      queue->async([work = std::move(work)] {
        work->waiting = false;
        work->task();
      });
    }
    afterEach();
  }
  const MonotonicTime now = clock_.monotonic();
  if (end > now) clock_.advance(end - now);
  afterEach();
}

size_t ManualTimers::pending() const {
  MutexLock lock(shared_->mutex);
  return shared_->armed.size();
}

}  // namespace kyt
