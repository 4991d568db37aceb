// What handlers and timers give to queues is gathered while one batch of events is handled. At a quiet rate
// the first few of these queues are then run right here; the others go to their executors.
//
// One mutex guards registrations and timers. No thread holds it while a handler runs, while a queue is given work, or
// while a watch is changed. A change of a watch takes the mutex of its registration instead: the descriptor is often
// ready already, which wakes the reactor's thread at once, and that thread must not wait for the caller.
//
// An event carries the number of its slot and the slot's generation. An event that was read before its watch was
// destroyed therefore finds nothing.
#include "platform/linux/base/EpollReactor.h"

#include <errno.h>
#include <sys/epoll.h>
#include <sys/timerfd.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <map>
#include <set>
#include <thread>
#include <utility>
#include <vector>

#include "platform/base/Blocking.h"
#include "platform/base/ConditionVariable.h"
#include "platform/base/Mutex.h"
#include "platform/linux/base/Descriptors.h"
#include "platform/linux/base/LeaderThreads.h"
#include "platform/queues/SerialQueue.h"

namespace kyt {

namespace {

constexpr uint64_t kStopEvent = ~uint64_t{0};
constexpr uint64_t kTimerEvent = kStopEvent - 1;
constexpr size_t kMostAside = 6;  // queues of one batch that the reactor's thread runs itself
constexpr Duration kShort = std::chrono::microseconds(50);  // … if they usually take no longer; otherwise one
constexpr Duration kLongRun = kShort * 4;  // a longer one (a flush) does not count for the next ones
constexpr Duration kLongest = std::chrono::hours(24 * 365 * 20);  // keeps sums of times in range

uint32_t epollEvents(unsigned events) {
  uint32_t result = 0;
  if ((events & ready::readable) != 0) result |= EPOLLIN | EPOLLRDHUP;
  if ((events & ready::writable) != 0) result |= EPOLLOUT;
  if ((events & ready::priority) != 0) result |= EPOLLPRI;
  if ((events & ready::edgeTriggered) != 0) result |= EPOLLET;
  if ((events & ready::oneShot) != 0) result |= EPOLLONESHOT;
  return result;
}

using QueuesAside = std::array<std::shared_ptr<SerialQueue>, kMostAside>;

void submit(std::shared_ptr<SerialQueue> queue) {
  Executor& executor = queue->executor();
  executor.submit(std::move(queue));
}

// Queues that the leader borrowed from their executors. When one blocks, another thread takes the lead, and
// the others go to their executors.
class AsideRun final : public BlockingObserver {
 public:
  AsideRun(LeaderThreads& threads, QueuesAside queues) : threads_(threads), queues_(std::move(queues)) {}
  ~AsideRun() override { submitRest(); }

  [[nodiscard]] bool runNext() {  // false: this thread leads no longer
    const std::shared_ptr<SerialQueue> queue = std::move(queues_[next_++]);
    number_ = threads_.beginAside();
    BlockingObserver* former = exchange(this);
    queue->runPending();
    exchange(former);
    queue->executor().giveBack();
    return threads_.endAside(number_);
  }
  [[nodiscard]] bool hasNext() const { return next_ < queues_.size() && queues_[next_] != nullptr; }

 private:
  void willBlock(BlockingKind) override {
    submitRest();
    threads_.giveLeadAway(number_);
  }
  void hasBlocked() override {}
  void submitRest() {
    for (; hasNext(); ++next_) {
      Executor& executor = queues_[next_]->executor();
      executor.submit(std::move(queues_[next_]));
      executor.giveBack();
    }
  }

  LeaderThreads& threads_;
  QueuesAside queues_;
  size_t next_ = 0;
  uint64_t number_ = 0;
};

unsigned readyBits(uint32_t events) {
  unsigned result = 0;
  if ((events & EPOLLIN) != 0) result |= ready::readable;
  if ((events & EPOLLOUT) != 0) result |= ready::writable;
  if ((events & EPOLLPRI) != 0) result |= ready::priority;
  if ((events & (EPOLLRDHUP | EPOLLHUP)) != 0) result |= ready::ended;
  if ((events & EPOLLERR) != 0) result |= ready::failed;
  return result;
}

}  // namespace

class EpollReactor::Registration final : public Watch::State {
 public:
  Registration(std::shared_ptr<Implementation> reactor, int descriptor, unsigned events, Handler handler)
      : reactor_(std::move(reactor)),
        descriptor_(descriptor),
        events_(events),
        handler_(std::move(handler)) {}
  bool modify(unsigned events) override;
  bool rearm() override;
  void cancel() override;

 private:
  friend class Implementation;
  const std::shared_ptr<Implementation> reactor_;
  const int descriptor_;
  std::atomic<unsigned> events_;
  uint64_t tag_ = 0;  // number and generation of its slot, constant once it is registered
  Mutex changing_;    // held over the system call, so that none follows the end of the watch
  bool registered_ GUARDED_BY(changing_) = false;
  // The reactor's thread's.
  Handler handler_;
};

class EpollReactor::Timer final : public TimerHandle::State, public std::enable_shared_from_this<Timer> {
 public:
  Timer(std::shared_ptr<Implementation> reactor, Duration period, Duration leeway,
        std::shared_ptr<SerialQueue> queue, Task work)
      : reactor_(std::move(reactor)),
        period_(period),
        leeway_(leeway),
        queue_(std::move(queue)),
        work_(std::make_shared<Work>(std::move(work))) {}
  void cancel() override;

 private:
  friend class Implementation;
  // A tick that finds the one before it still waiting for its queue is missed: a queue that is held up is not
  // buried in ticks.
  struct Work {
    explicit Work(Task what) : task(std::move(what)) {}
    void run() {
      waiting = false;
      task();
    }
    Task task;
    std::atomic<bool> waiting{false};
  };
  const std::shared_ptr<Implementation> reactor_;
  const Duration period_;  // zero: once
  const Duration leeway_;
  // Guarded by the reactor's mutex. What runs once is given away when it is due, so that a handle that lives
  // on keeps nothing alive.
  std::shared_ptr<SerialQueue> queue_;
  std::shared_ptr<Work> work_;
  MonotonicTime due_;
  uint64_t id_ = 0;
  bool armed_ = false;
};

class EpollReactor::Implementation : public std::enable_shared_from_this<Implementation> {
 public:
  explicit Implementation(const char* threadName) : threads_(threadName, [this] { run(); }) {}
  [[nodiscard]] bool start();
  void stop();
  Watch watch(int descriptor, unsigned events, Handler handler);
  [[nodiscard]] bool modify(Registration& registration, unsigned events);
  [[nodiscard]] bool rearm(Registration& registration);
  void cancel(Registration& registration);
  TimerHandle arm(Duration delay, Duration period, Duration leeway, std::shared_ptr<SerialQueue> queue,
                  Task work);
  void cancel(Timer& timer);
  [[nodiscard]] uint64_t wakeUps() const { return wakeUps_.load(std::memory_order_relaxed); }
  [[nodiscard]] unsigned threads() { return threads_.threads(); }

 private:
  struct Slot {
    std::shared_ptr<Registration> registration;
    uint32_t generation = 0;
  };
  using TimerKey = std::pair<MonotonicTime, uint64_t>;

  void run();
  void handleEvents(int count);
  [[nodiscard]] QueuesAside sortDeferred(Turn& turn);
  [[nodiscard]] bool runAside(QueuesAside queues);
  void dispatch(uint64_t tag, uint32_t events);
  void fireTimers();
  [[nodiscard]] bool control(int operation, const Registration& registration)
      REQUIRES(registration.changing_);
  void insert(std::shared_ptr<Timer> timer) REQUIRES(mutex_);
  [[nodiscard]] std::shared_ptr<Timer> remove(Timer& timer) REQUIRES(mutex_);
  void setAlarm() REQUIRES(mutex_);

  Descriptor epoll_, alarm_, stopEvent_;  // constant after start()
  LeaderThreads threads_;
  std::atomic<uint64_t> wakeUps_{0};
  std::atomic<bool> stopping_{false};
  // The leading thread's.
  std::array<epoll_event, 128> events_;
  MonotonicTime turnBegin_{};
  Duration usualRun_ = kShort * 2;

  Mutex mutex_;
  ConditionVariable handlerDone_;
  std::vector<Slot> slots_ GUARDED_BY(mutex_);
  std::vector<uint32_t> freeSlots_ GUARDED_BY(mutex_);
  const Registration* running_ GUARDED_BY(mutex_) = nullptr;  // whose handler runs
  std::thread::id runningOn_ GUARDED_BY(mutex_);
  unsigned awaitingHandler_ GUARDED_BY(mutex_) = 0;
  std::map<TimerKey, std::shared_ptr<Timer>> timersByDue_ GUARDED_BY(mutex_);
  std::set<TimerKey> timersByLatest_ GUARDED_BY(mutex_);
  MonotonicTime alarmAt_ GUARDED_BY(mutex_){};  // zero: not set
  std::atomic<bool> alarmRefused_{false};
  uint64_t nextTimer_ GUARDED_BY(mutex_) = 0;
};

bool EpollReactor::Registration::modify(unsigned events) {
  return reactor_->modify(*this, events);
}
bool EpollReactor::Registration::rearm() {
  return reactor_->rearm(*this);
}
void EpollReactor::Registration::cancel() {
  reactor_->cancel(*this);
}
void EpollReactor::Timer::cancel() {
  reactor_->cancel(*this);
}

bool EpollReactor::Implementation::start() {
  epoll_ = ownDescriptor(epoll_create1(EPOLL_CLOEXEC));
  alarm_ = ownDescriptor(timerfd_create(CLOCK_MONOTONIC, TFD_CLOEXEC | TFD_NONBLOCK));
  stopEvent_ = makeEventDescriptor();
  if (epoll_.get() < 0 || alarm_.get() < 0 || stopEvent_.get() < 0) return false;
  epoll_event event{};
  event.events = EPOLLIN;
  event.data.u64 = kStopEvent;
  if (epoll_ctl(epoll_.get(), EPOLL_CTL_ADD, stopEvent_.get(), &event) != 0) return false;
  event.events = EPOLLIN | EPOLLET;  // setting it anew clears it, so it is never read
  event.data.u64 = kTimerEvent;
  if (epoll_ctl(epoll_.get(), EPOLL_CTL_ADD, alarm_.get(), &event) != 0) return false;
  return threads_.start();
}

void EpollReactor::Implementation::stop() {
  stopping_ = true;
  signalEventDescriptor(stopEvent_.get());
  threads_.stop();
  // Destroyed without the lock.
  std::vector<std::pair<std::shared_ptr<SerialQueue>, std::shared_ptr<Timer::Work>>> works;
  std::map<TimerKey, std::shared_ptr<Timer>> dropped;
  MutexLock lock(mutex_);
  for (auto& [key, timer] : timersByDue_) {
    timer->armed_ = false;
    works.emplace_back(std::move(timer->queue_), std::move(timer->work_));
  }
  timersByLatest_.clear();
  dropped.swap(timersByDue_);
}

void EpollReactor::Implementation::run() {
  while (!stopping_) {
    const int count = epoll_wait(epoll_.get(), events_.data(), static_cast<int>(events_.size()), -1);
    wakeUps_.fetch_add(1, std::memory_order_relaxed);
    QueuesAside queues;
    {
      Turn turn;
      handleEvents(count);
      queues = sortDeferred(turn);
    }
    if (queues[0] != nullptr && !runAside(std::move(queues))) return;
  }
}

void EpollReactor::Implementation::handleEvents(int count) {
  bool due = false;
  for (int i = 0; i < count && !stopping_; ++i) {
    const epoll_event& event = events_[static_cast<size_t>(i)];
    if (event.data.u64 == kTimerEvent) {
      due = true;
    } else if (event.data.u64 != kStopEvent) {
      dispatch(event.data.u64, event.events);
    }
  }
  if ((due || alarmRefused_.load(std::memory_order_relaxed)) && !stopping_) fireTimers();
}

// Returns what to run here; everything else is with its executor.
QueuesAside EpollReactor::Implementation::sortDeferred(Turn& turn) {
  QueuesAside aside;
  std::shared_ptr<SerialQueue> queue = turn.takeFirst();
  if (!queue) return aside;
  turnBegin_ = std::chrono::steady_clock::now();
  size_t most = 0;
  if (!stopping_ && threads_.mayRunAside(turnBegin_)) most = usualRun_ <= kShort ? kMostAside : 1;
  for (size_t count = 0; queue != nullptr; queue = turn.takeFirst()) {
    if (count < most && queue->executor().borrow()) {
      aside[count++] = std::move(queue);
    } else {
      submit(std::move(queue));
    }
  }
  return aside;
}

// False when another thread leads now: then nothing of the leading thread's may be touched.
bool EpollReactor::Implementation::runAside(QueuesAside queues) {
  AsideRun run(threads_, std::move(queues));
  MonotonicTime begin = turnBegin_;
  while (run.hasNext()) {
    if (!run.runNext()) return false;
    const MonotonicTime end = std::chrono::steady_clock::now();
    usualRun_ += (std::min<Duration>(end - begin, kLongRun) - usualRun_) / 8;
    begin = end;
  }
  return true;
}

void EpollReactor::Implementation::dispatch(uint64_t tag, uint32_t events) {
  std::shared_ptr<Registration> registration;  // a handler may destroy its own watch
  unsigned bits;
  {
    MutexLock lock(mutex_);
    const Slot& slot = slots_[static_cast<uint32_t>(tag)];
    if (slot.generation != tag >> 32 || slot.registration == nullptr) return;
    bits = readyBits(events) & (slot.registration->events_ | ready::ended | ready::failed);
    if (bits == 0) return;  // no longer asked for
    registration = slot.registration;
    running_ = registration.get();
    runningOn_ = std::this_thread::get_id();
  }
  registration->handler_(bits);
  MutexLock lock(mutex_);
  running_ = nullptr;
  runningOn_ = {};
  if (awaitingHandler_ > 0) handlerDone_.notifyAll();
}

bool EpollReactor::Implementation::control(int operation, const Registration& registration) {
  epoll_event event{};
  event.events = epollEvents(registration.events_);
  event.data.u64 = registration.tag_;
  return epoll_ctl(epoll_.get(), operation, registration.descriptor_, &event) == 0;
}

Watch EpollReactor::Implementation::watch(int descriptor, unsigned events, Handler handler) {
  auto registration =
      std::make_shared<Registration>(shared_from_this(), descriptor, events, std::move(handler));
  MutexLock lock(mutex_);
  if (stopping_) return {};
  if (freeSlots_.empty()) {
    freeSlots_.push_back(static_cast<uint32_t>(slots_.size()));
    slots_.emplace_back();
  }
  const uint32_t slot = freeSlots_.back();
  registration->tag_ = uint64_t{slots_[slot].generation} << 32 | slot;
  MutexLock changing(registration->changing_);
  if (!control(EPOLL_CTL_ADD, *registration)) return {};
  freeSlots_.pop_back();
  registration->registered_ = true;
  slots_[slot].registration = registration;
  return Watch(registration);
}

bool EpollReactor::Implementation::modify(Registration& registration, unsigned events) {
  MutexLock changing(registration.changing_);
  if (!registration.registered_) return false;
  registration.events_ = events;
  return control(EPOLL_CTL_MOD, registration);
}

bool EpollReactor::Implementation::rearm(Registration& registration) {
  MutexLock changing(registration.changing_);
  return registration.registered_ && control(EPOLL_CTL_MOD, registration);
}

void EpollReactor::Implementation::cancel(Registration& registration) {
  {
    MutexLock changing(registration.changing_);
    if (!registration.registered_) return;
    registration.registered_ = false;
    (void)control(EPOLL_CTL_DEL, registration);
  }
  std::shared_ptr<Registration> dropped;  // destroyed without the lock
  MutexLock lock(mutex_);
  const auto number = static_cast<uint32_t>(registration.tag_);
  Slot& slot = slots_[number];
  dropped = std::move(slot.registration);
  ++slot.generation;
  freeSlots_.push_back(number);
  if (runningOn_ == std::this_thread::get_id()) return;
  ++awaitingHandler_;
  while (running_ == &registration) handlerDone_.wait(mutex_);
  --awaitingHandler_;
}

TimerHandle EpollReactor::Implementation::arm(Duration delay, Duration period, Duration leeway,
                                              std::shared_ptr<SerialQueue> queue, Task work) {
  auto timer = std::make_shared<Timer>(shared_from_this(), period, leeway, std::move(queue), std::move(work));
  timer->due_ = std::chrono::steady_clock::now() + std::clamp(delay, Duration::zero(), kLongest);
  MutexLock lock(mutex_);
  if (!stopping_) {
    timer->id_ = nextTimer_++;
    insert(timer);
    setAlarm();
  }
  return TimerHandle(std::move(timer));
}

void EpollReactor::Implementation::insert(std::shared_ptr<Timer> timer) {
  timer->armed_ = true;
  timersByLatest_.emplace(timer->due_ + timer->leeway_, timer->id_);
  const TimerKey key{timer->due_, timer->id_};
  timersByDue_.emplace(key, std::move(timer));
}

std::shared_ptr<EpollReactor::Timer> EpollReactor::Implementation::remove(Timer& timer) {
  timer.armed_ = false;
  timersByLatest_.erase({timer.due_ + timer.leeway_, timer.id_});
  return std::move(timersByDue_.extract({timer.due_, timer.id_}).mapped());
}

void EpollReactor::Implementation::cancel(Timer& timer) {
  std::shared_ptr<Timer> dropped;  // destroyed without the lock
  MutexLock lock(mutex_);
  if (!timer.armed_) return;
  dropped = remove(timer);
  setAlarm();
}

void EpollReactor::Implementation::setAlarm() {
  const MonotonicTime next = timersByLatest_.empty() ? MonotonicTime{} : timersByLatest_.begin()->first;
  if (next == alarmAt_) return;
  alarmAt_ = next;
  const auto sinceEpoch = next.time_since_epoch();
  const auto whole = std::chrono::floor<std::chrono::seconds>(sinceEpoch);
  itimerspec setting{};  // all zero: off
  setting.it_value.tv_sec = static_cast<time_t>(whole.count());
  setting.it_value.tv_nsec = static_cast<long>((sinceEpoch - whole).count());
  // Without the alarm no timer would fire any more, later ones neither. Refused for longer than this, it is asked for
  // again at the next event and with the next timer.
  constexpr int kTries = 10;
  int tries = 0;
  while (timerfd_settime(alarm_.get(), TFD_TIMER_ABSTIME, &setting, nullptr) != 0 && tries < kTries) ++tries;
  alarmRefused_ = tries == kTries;
  if (alarmRefused_) alarmAt_ = {};
}

void EpollReactor::Implementation::fireTimers() {
  std::vector<std::pair<std::shared_ptr<SerialQueue>, std::shared_ptr<Timer::Work>>> due;
  std::vector<std::shared_ptr<Timer>> timers;  // destroyed without the lock
  {
    MutexLock lock(mutex_);
    const MonotonicTime now = std::chrono::steady_clock::now();
    while (!timersByDue_.empty() && timersByDue_.begin()->first.first <= now)
      timers.push_back(remove(*timersByDue_.begin()->second));
    for (const std::shared_ptr<Timer>& timer : timers) {
      if (timer->period_ <= Duration::zero()) {
        due.emplace_back(std::move(timer->queue_), std::move(timer->work_));
        continue;
      }
      if (!timer->work_->waiting.exchange(true)) due.emplace_back(timer->queue_, timer->work_);
      timer->due_ += timer->period_ * ((now - timer->due_) / timer->period_ + 1);
      insert(timer);
    }
    if (alarmAt_ <= now) alarmAt_ = {};  // it has gone off
    setAlarm();
  }
  for (auto& [queue, work] : due) queue->async([work = std::move(work)] { work->run(); });
}

std::unique_ptr<EpollReactor> EpollReactor::create(const char* threadName) {
  auto implementation = std::make_shared<Implementation>(threadName);
  if (!implementation->start()) return nullptr;
  return std::unique_ptr<EpollReactor>(new EpollReactor(std::move(implementation)));
}

EpollReactor::EpollReactor(std::shared_ptr<Implementation> implementation)
    : implementation_(std::move(implementation)) {}
EpollReactor::~EpollReactor() {
  stop();
}
void EpollReactor::stop() {
  implementation_->stop();
}
uint64_t EpollReactor::wakeUps() const {
  return implementation_->wakeUps();
}

unsigned EpollReactor::threads() const {
  return implementation_->threads();
}

Watch EpollReactor::watch(int descriptor, unsigned events, Handler handler) {
  return implementation_->watch(descriptor, events, std::move(handler));
}

TimerHandle EpollReactor::after(Duration delay, std::shared_ptr<SerialQueue> queue, Task work) {
  return implementation_->arm(delay, Duration::zero(), Duration::zero(), std::move(queue), std::move(work));
}

TimerHandle EpollReactor::every(Duration period, Duration leeway, std::shared_ptr<SerialQueue> queue,
                                Task work) {
  period = std::clamp<Duration>(period, std::chrono::milliseconds(1), kLongest);
  leeway = std::clamp(leeway, Duration::zero(), kLongest);
  return implementation_->arm(period, period, leeway, std::move(queue), std::move(work));
}

}  // namespace kyt
