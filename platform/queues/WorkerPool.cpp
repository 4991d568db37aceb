// One mutex guards the pool; it is held for moments only. Idle workers sleep each on a condition of its own
// and are woken last in, first out, so that few stay warm and the others reach their time-out.
#include "platform/queues/WorkerPool.h"

#include <algorithm>
#include <atomic>
#include <cstdio>
#include <deque>
#include <map>
#include <system_error>
#include <thread>
#include <utility>
#include <vector>

#include "platform/base/Blocking.h"
#include "platform/base/ConditionVariable.h"
#include "platform/base/Counters.h"
#include "platform/base/Mutex.h"
#include "platform/queues/Log.h"
#include "platform/queues/OwnerLines.h"
#include "platform/queues/SerialQueue.h"

namespace kyt {

namespace {

constexpr Duration kRefusedPause = std::chrono::milliseconds(10);
constexpr size_t kLeftForOneInLine = 4;  // workers that are left, for each of one owner's that stands in line

}  // namespace

struct WorkerPool::Worker final : BlockingObserver {
  static thread_local Worker* current;
  Implementation* pool = nullptr;
  unsigned number = 0;
  std::thread thread;
  ConditionVariable wake;
  // Guarded by the pool's mutex.
  bool alive = false;
  bool woken = false;
  uint64_t owner = 0;   // of the queue it runs
  bool inLine = false;  // for a lock that others' queues hold
  // Its own thread's.
  const SerialQueue* queue = nullptr;  // what it runs

  void willBlock(BlockingKind kind) override;
  void hasBlocked() override;
};

thread_local WorkerPool::Worker* WorkerPool::Worker::current = nullptr;

class WorkerPool::Implementation {
 public:
  explicit Implementation(WorkerPoolOptions options) : options_(options) {
    if (options_.runnable == 0) options_.runnable = std::max(2u, std::thread::hardware_concurrency());
    options_.maxWorkers = std::max<size_t>(options_.maxWorkers, 1);
    mostOfOneOwner_ = options_.mostOfOneOwner;
    if (mostOfOneOwner_ == 0) mostOfOneOwner_ = std::max<size_t>(options_.maxWorkers / 2, 1);
  }

  void submit(std::shared_ptr<SerialQueue> queue);
  bool shutDown(MonotonicTime end);
  void stopInsisting();
  void tryAgain();
  void block(Worker& self, bool inLine);
  void unblock(Worker& self);
  [[nodiscard]] bool borrow();
  void giveBack();
  [[nodiscard]] bool hasMuchReady();
  [[nodiscard]] WorkerPoolFigures figures();

 private:
  using Queues = std::deque<std::shared_ptr<SerialQueue>>;

  void work(Worker& self);
  bool sleep(Worker& self) REQUIRES(mutex_);
  bool hasWorkAfterQuiet() REQUIRES(mutex_);
  std::shared_ptr<SerialQueue> take(Worker& self) REQUIRES(mutex_);
  void release(Worker& self) REQUIRES(mutex_);
  void unpark(uint64_t owner) REQUIRES(mutex_);
  void countExhausted() REQUIRES(mutex_);
  void tellExhausted();
  [[nodiscard]] bool ownerMayRun(uint64_t owner) REQUIRES(mutex_);
  [[nodiscard]] Worker* workerToWake() REQUIRES(mutex_);
  [[nodiscard]] bool nobodyComes() const REQUIRES(mutex_) { return !ready_.empty() && workers_ == 0; }
  void insistOnAWorker();
  void start() REQUIRES(mutex_);

  WorkerPoolOptions options_;  // constant, like the next
  size_t mostOfOneOwner_;

  Mutex mutex_;
  // Those of workers that ended are used again.
  std::vector<std::unique_ptr<Worker>> slots_ GUARDED_BY(mutex_);
  std::vector<Worker*> idle_ GUARDED_BY(mutex_);  // asleep; the last one is woken first
  OwnerLines<SerialQueue> ready_ GUARDED_BY(mutex_);
  std::map<uint64_t, Queues> parked_ GUARDED_BY(mutex_);  // queues of owners that hold their share
  uint64_t unparked_ GUARDED_BY(mutex_) = 0;              // the owner whose turn it was last
  ConditionVariable allEnded_;
  std::thread ended_ GUARDED_BY(mutex_);  // the last worker that ended; the next to end joins it
  size_t workers_ GUARDED_BY(mutex_) = 0;
  size_t running_ GUARDED_BY(mutex_) = 0;  // neither asleep nor blocked
  size_t looking_ GUARDED_BY(mutex_) = 0;  // … of which about to look for work
  size_t blocked_ GUARDED_BY(mutex_) = 0;
  size_t inLine_ GUARDED_BY(mutex_) = 0;  // … of which for a lock
  size_t mostWorkers_ GUARDED_BY(mutex_) = 0;
  uint64_t wakeUps_ GUARDED_BY(mutex_) = 0;
  size_t borrowed_ GUARDED_BY(mutex_) = 0;  // queues that threads of others run
  bool stopping_ GUARDED_BY(mutex_) = false;
  bool insists_ GUARDED_BY(mutex_) = true;
  bool workedSinceQuiet_ GUARDED_BY(mutex_) = false;
  bool mustTell_ GUARDED_BY(mutex_) = false;  // that work waited; told by the next worker, without the lock
};

void WorkerPool::Implementation::submit(std::shared_ptr<SerialQueue> queue) {
  Worker* toWake = nullptr;
  bool stranded = false;
  {
    MutexLock lock(mutex_);
    if (!stopping_) {
      // A queue that its own worker submits has just been left with work: that worker looks for work next.
      const bool looksNext = Worker::current != nullptr && Worker::current->queue == queue.get();
      ready_.push(std::move(queue));
      if (!looksNext) toWake = workerToWake();
      stranded = nobodyComes() && insists_;
    }
  }
  if (toWake != nullptr) toWake->wake.notifyOne();
  if (stranded) insistOnAWorker();
  if (queue) queue->discardPending();  // NOLINT(bugprone-use-after-move): null when it was moved
}

// The system refused a thread, and there is no worker that would look for work when it is done: what is ready would
// wait until something else happens, and that may be never (a listener is armed again by the very work that waits).
// Better that the caller waits.
void WorkerPool::Implementation::insistOnAWorker() {
  if (options_.log != nullptr)
    options_.log->error("WorkerPool(submit): the system refuses a thread, work waits");
  for (;;) {
    std::this_thread::sleep_for(kRefusedPause);
    Worker* toWake = nullptr;
    bool stranded = false;
    {
      MutexLock lock(mutex_);
      if (stopping_ || !insists_) return;
      toWake = workerToWake();
      stranded = nobodyComes();
    }
    if (toWake != nullptr) toWake->wake.notifyOne();
    if (!stranded) return;
  }
}

void WorkerPool::Implementation::stopInsisting() {
  MutexLock lock(mutex_);
  insists_ = false;
}

void WorkerPool::Implementation::tryAgain() {
  Worker* toWake = nullptr;
  {
    MutexLock lock(mutex_);
    if (!stopping_) toWake = workerToWake();
  }
  if (toWake != nullptr) toWake->wake.notifyOne();
}

// Counts a sleeping worker as looking and returns it, or starts one, if work waits that no worker would see
// soon.
WorkerPool::Worker* WorkerPool::Implementation::workerToWake() {
  if (ready_.empty() || looking_ > 0 || running_ >= options_.runnable) return nullptr;
  if (idle_.empty()) {
    if (workers_ < options_.maxWorkers) {
      start();
    } else {
      countExhausted();
    }
    return nullptr;
  }
  Worker* worker = idle_.back();
  idle_.pop_back();
  worker->woken = true;
  ++running_;
  ++looking_;
  ++wakeUps_;
  return worker;
}

void WorkerPool::Implementation::start() {
  auto found = std::find_if(slots_.begin(), slots_.end(), [](const auto& slot) { return !slot->alive; });
  if (found == slots_.end()) {
    slots_.push_back(std::make_unique<Worker>());
    found = slots_.end() - 1;
    (*found)->pool = this;
    (*found)->number = static_cast<unsigned>(slots_.size());
  }
  Worker& worker = **found;
  try {
    worker.thread = std::thread([this, &worker] { work(worker); });
  } catch (const std::system_error&) {
    return;
  }
  worker.alive = true;
  mostWorkers_ = std::max(mostWorkers_, ++workers_);
  ++running_;
  ++looking_;
  ++wakeUps_;
}

void WorkerPool::Implementation::work(Worker& self) {
  Worker::current = &self;
  BlockingObserver::exchange(&self);
  if (options_.nameThread != nullptr) {
    char name[16];
    std::snprintf(name, sizeof name, "%.11s-%u", options_.name, self.number % 1000);
    options_.nameThread(name);
  }
  std::thread ended;
  mutex_.lock();
  for (;;) {
    std::shared_ptr<SerialQueue> queue;
    if (!stopping_ && running_ <= options_.runnable) queue = take(self);
    if (!queue) {
      if (sleep(self) || hasWorkAfterQuiet()) continue;
      break;
    }
    --looking_;
    workedSinceQuiet_ = true;
    Worker* next = workerToWake();
    const bool mustTell = std::exchange(mustTell_, false);
    mutex_.unlock();
    if (next != nullptr) next->wake.notifyOne();
    if (mustTell) tellExhausted();
    self.queue = queue.get();
    queue->runPending();
    self.queue = nullptr;
    queue.reset();
    mutex_.lock();
    ++looking_;
    release(self);
  }
  self.alive = false;
  if (--workers_ == 0) allEnded_.notifyAll();
  ended = std::exchange(ended_, std::move(self.thread));
  mutex_.unlock();
  if (ended.joinable()) ended.join();
}

// Until there is work to look for; false when the worker is to end.
bool WorkerPool::Implementation::sleep(Worker& self) {
  --looking_;
  --running_;
  if (stopping_) return false;
  self.woken = false;
  idle_.push_back(&self);
  const MonotonicTime deadline = std::chrono::steady_clock::now() + options_.idleExit;
  while (!self.woken)
    if (!self.wake.waitUntil(mutex_, deadline) && !self.woken) {
      idle_.erase(std::find(idle_.begin(), idle_.end(), &self));
      return false;
    }
  return true;
}

// Of a worker that ends for want of work. A program that goes on reporting keeps one worker for ever, so the pool is
// quiet too when the last but one ends: the load that needed two is over. Work that came meanwhile may have found no
// thread, and counted on this one.
bool WorkerPool::Implementation::hasWorkAfterQuiet() {
  if (workers_ > 2 || stopping_ || options_.whenQuiet == nullptr || !workedSinceQuiet_) return false;
  workedSinceQuiet_ = false;
  mutex_.unlock();
  options_.whenQuiet();
  mutex_.lock();
  if (stopping_ || ready_.empty()) return false;
  ++running_;
  ++looking_;
  return true;
}

std::shared_ptr<SerialQueue> WorkerPool::Implementation::take(Worker& self) {
  while (std::shared_ptr<SerialQueue> queue = ready_.pop()) {
    if (ownerMayRun(queue->owner())) {
      self.owner = queue->owner();
      return queue;
    }
    countExhausted();
    parked_[queue->owner()].push_back(std::move(queue));
  }
  return nullptr;
}

// Of the workers that are left an owner may hold as many again as it holds, up to its half; and it may have a quarter as
// many in line for a lock. So however many owners hold what they may, the next one finds workers. Who holds none may run:
// the worker that asks is one of those that are left.
bool WorkerPool::Implementation::ownerMayRun(uint64_t owner) {
  const size_t used = running_ + blocked_ - looking_, left = options_.maxWorkers - used;
  if (owner == 0) return true;
  if (used < std::min(mostOfOneOwner_, left) && inLine_ * kLeftForOneInLine < left) return true;
  size_t held = 0, inLine = 0;
  for (const auto& slot : slots_) {
    if (!slot->alive || slot->owner != owner) continue;
    ++held;
    if (slot->inLine) ++inLine;
  }
  return held < std::min(mostOfOneOwner_, left) && (inLine == 0 || inLine * kLeftForOneInLine < left);
}

// The worker has run its queue. What waited for a worker of this owner is next in line again; and what another owner's
// shares kept back, in turns, since there is a worker more now.
void WorkerPool::Implementation::release(Worker& self) {
  const uint64_t owner = std::exchange(self.owner, 0);
  if (parked_.empty()) return;
  unpark(owner);
  auto next = parked_.upper_bound(unparked_);
  if (next == parked_.end()) next = parked_.begin();
  if (next == parked_.end() || next->first == owner) return;
  unparked_ = next->first;
  unpark(unparked_);
}

void WorkerPool::Implementation::unpark(uint64_t owner) {
  const auto found = parked_.find(owner);
  if (found == parked_.end() || !ownerMayRun(owner)) return;
  ready_.pushFirst(std::move(found->second.front()));
  found->second.pop_front();
  if (found->second.empty()) parked_.erase(found);
}

void WorkerPool::Implementation::countExhausted() {
  if (options_.counters == nullptr) return;
  options_.counters->add(Reason::workersExhausted);
  mustTell_ = options_.log != nullptr;
}

void WorkerPool::Implementation::tellExhausted() {
  if (options_.counters->addAndMayLog(Reason::workersExhausted, std::chrono::steady_clock::now(), 0))
    options_.log->normal("WorkerPool(work): work waits, as many workers as may be are in use");
}

void WorkerPool::Implementation::block(Worker& self, bool inLine) {
  Worker* toWake;
  {
    MutexLock lock(mutex_);
    --running_;
    ++blocked_;
    self.inLine = inLine;
    if (inLine) ++inLine_;
    toWake = workerToWake();
  }
  if (toWake != nullptr) toWake->wake.notifyOne();
}

void WorkerPool::Implementation::unblock(Worker& self) {
  MutexLock lock(mutex_);
  --blocked_;
  ++running_;
  if (std::exchange(self.inLine, false)) --inLine_;
}

bool WorkerPool::Implementation::borrow() {
  MutexLock lock(mutex_);
  if (stopping_) return false;
  ++borrowed_;
  return true;
}

void WorkerPool::Implementation::giveBack() {
  MutexLock lock(mutex_);
  if (--borrowed_ == 0 && stopping_) allEnded_.notifyAll();
}

bool WorkerPool::Implementation::hasMuchReady() {
  MutexLock lock(mutex_);
  return ready_.size() >= options_.runnable;
}

bool WorkerPool::Implementation::shutDown(MonotonicTime end) {
  std::vector<Worker*> sleepers;
  {
    MutexLock lock(mutex_);
    stopping_ = true;
    sleepers.swap(idle_);
    for (Worker* worker : sleepers) worker->woken = true;
    running_ += sleepers.size();
    looking_ += sleepers.size();
  }
  for (Worker* worker : sleepers) worker->wake.notifyOne();
  std::thread last;
  std::vector<std::shared_ptr<SerialQueue>> pending;
  {
    MutexLock lock(mutex_);
    while (workers_ > 0 || borrowed_ > 0) {
      if (end == MonotonicTime::max())
        allEnded_.wait(mutex_);
      else if (!allEnded_.waitUntil(mutex_, end) && (workers_ > 0 || borrowed_ > 0))
        return false;
    }
    last = std::move(ended_);
    pending = ready_.takeAll();
    for (auto& [owner, queues] : parked_)
      pending.insert(pending.end(), std::make_move_iterator(queues.begin()),
                     std::make_move_iterator(queues.end()));
    parked_.clear();
  }
  if (last.joinable()) last.join();  // it has joined the one that ended before it, and so on
  for (const std::shared_ptr<SerialQueue>& queue : pending) queue->discardPending();
  return true;
}

WorkerPoolFigures WorkerPool::Implementation::figures() {
  MutexLock lock(mutex_);
  WorkerPoolFigures figures;
  figures.workers = workers_;
  figures.idle = idle_.size();
  figures.blocked = blocked_;
  figures.waitingQueues = ready_.size();
  for (const auto& [owner, queues] : parked_) figures.waitingQueues += queues.size();
  figures.mostWorkers = mostWorkers_;
  figures.wakeUps = wakeUps_;
  return figures;
}

WorkerPool::WorkerPool(WorkerPoolOptions options)
    : implementation_(std::make_unique<Implementation>(options)) {}
WorkerPool::~WorkerPool() {
  shutDown();
}
void WorkerPool::submit(std::shared_ptr<SerialQueue> queue) {
  implementation_->submit(std::move(queue));
}
bool WorkerPool::borrow() {
  return implementation_->borrow();
}
void WorkerPool::giveBack() {
  implementation_->giveBack();
}
bool WorkerPool::hasMuchReady() {
  return implementation_->hasMuchReady();
}
void WorkerPool::stopInsisting() {
  implementation_->stopInsisting();
}
void WorkerPool::tryAgain() {
  implementation_->tryAgain();
}
void WorkerPool::shutDown() {
  static_cast<void>(implementation_->shutDown(MonotonicTime::max()));
}
bool WorkerPool::shutDownWithin(Duration patience) {
  return implementation_->shutDown(std::chrono::steady_clock::now() + patience);
}
WorkerPoolFigures WorkerPool::figures() const {
  return implementation_->figures();
}

void WorkerPool::Worker::willBlock(BlockingKind kind) {
  if (kind != BlockingKind::computing) pool->block(*this, kind == BlockingKind::inLine);
}
void WorkerPool::Worker::hasBlocked() {
  pool->unblock(*this);
}

}  // namespace kyt
