// The queue is a word of atomic state and a list, no lock: a synchronous call on an idle queue is one
// exchange in and one out. Submitted work is pushed on the state word newest first; the thread that runs the
// queue takes it all at once and turns it round. A caller of sync() that must wait stands in the same list
// with a node on its own stack, so one order holds for both kinds, and the queue passes straight from thread
// to thread without being free in between.
#include "platform/queues/SerialQueue.h"

#include <cassert>
#include <cstdio>
#include <cstdlib>
#include <utility>

#include "platform/base/SpinPause.h"

namespace kyt {

namespace {

constexpr uintptr_t kRunning = 1;
constexpr uintptr_t kScheduled = 2;
constexpr uintptr_t kFlags = kRunning | kScheduled;
constexpr int kSpins = 40;                // about a microsecond: most work is shorter than a thread switch
constexpr unsigned kMostRunsAtEnd = 256;  // of queues at the end of one turn; then the rest goes to executors

thread_local char identity;  // its address tells threads apart
thread_local Turn* currentTurn = nullptr;
thread_local uint64_t currentOwner = 0;

}  // namespace

struct SerialQueue::Node {
  Node* next = nullptr;
  bool isWaiter = false;
  Task task;
};

struct SerialQueue::Waiter : Node {
  Waiter() { isWaiter = true; }
  std::atomic<int> granted{0};
};

// Nodes that this thread has run, for its next calls of async(): on the road of one event the same thread
// submits and runs, and allocates nothing.
struct SerialQueue::NodeCache {
  static constexpr unsigned kMost = 32;
  Node* first = nullptr;
  unsigned count = 0;
  bool closed = false;

  ~NodeCache() {
    closed = true;
    while (first != nullptr) delete std::exchange(first, first->next);
  }
  Node* make(Task&& task) {
    if (first == nullptr) {
      auto node = std::make_unique<Node>();
      node->task = std::move(task);
      return node.release();
    }
    Node* node = std::exchange(first, first->next);
    --count;
    node->task = std::move(task);
    return node;
  }
  void recycle(Node* node) {
    node->task.reset();
    if (closed || count == kMost) {
      delete node;
      return;
    }
    ++count;
    node->next = std::exchange(first, node);
  }
  static NodeCache& ofThread() {
    thread_local NodeCache cache;
    return cache;
  }
};

struct SerialQueue::Concrete final : SerialQueue {
  Concrete(const char* label, Executor& executor, uint64_t owner) : SerialQueue(label, executor, owner) {}
};

std::shared_ptr<SerialQueue> SerialQueue::create(const char* label, Executor& executor, uint64_t owner) {
  static_assert(sizeof(Concrete) + 2 * sizeof(void*) <= 96, "an idle queue is one block of at most 96 bytes");
  return std::make_shared<Concrete>(label, executor, owner);
}

SerialQueue::SerialQueue(const char* label, Executor& executor, uint64_t owner)
    : label_(label), executor_(executor), owner_(owner) {}

SerialQueue::~SerialQueue() {
  collect(state_.load(std::memory_order_acquire));
  while (head_ != nullptr) NodeCache::ofThread().recycle(std::exchange(head_, head_->next));
}

bool SerialQueue::isCurrent() const noexcept {
  return runner_.load(std::memory_order_relaxed) == &identity;
}

void SerialQueue::async(Task task) {
  submit(std::move(task), true);
}

void SerialQueue::asyncBeside(Task task) {
  submit(std::move(task), false);
}

void SerialQueue::submit(Task task, bool mayDefer) {
  Node* node = NodeCache::ofThread().make(std::move(task));
  std::shared_ptr<SerialQueue> self;
  uintptr_t state = state_.load(std::memory_order_relaxed);
  uintptr_t next;
  do {
    node->next = reinterpret_cast<Node*>(state & ~kFlags);
    next = reinterpret_cast<uintptr_t>(node) | (state & kFlags);
    if ((state & kFlags) == 0) {
      next |= kScheduled;
      if (!self) self = shared_from_this();  // before others can run the work and drop the queue
    }
  } while (!state_.compare_exchange_weak(state, next, std::memory_order_acq_rel, std::memory_order_relaxed));
  // The list owns the node from here on.  NOLINTNEXTLINE(clang-analyzer-cplusplus.NewDeleteLeaks)
  if ((state & kFlags) == 0) schedule(std::move(self), mayDefer);
}

void SerialQueue::schedule(std::shared_ptr<SerialQueue> self, bool mayDefer) {
  if (mayDefer && currentTurn != nullptr) {
    currentTurn->defer(std::move(self));
  } else {
    executor_.submit(std::move(self));
  }
}

void SerialQueue::enter() {
  uintptr_t idle = 0;
  if (!state_.compare_exchange_strong(idle, kRunning, std::memory_order_acq_rel, std::memory_order_relaxed))
    enterContended();
  runner_.store(&identity, std::memory_order_relaxed);
}

void SerialQueue::enterContended() {
  if (isCurrent()) {  // waiting for oneself: better a report than a silent stop
    std::fprintf(stderr, "SerialQueue(sync): called from the queue \"%s\" onto itself\n", label_);
    std::abort();
  }
  if (takePending()) return runReady(~0u);  // nobody runs it: work was left for later
  enterAfterOthers();
}

void SerialQueue::enterAfterOthers() {
  Waiter waiter;
  for (int spin = 0;; ++spin) {
    spinPause();
    if (takePending()) return runReady(~0u);
    if (spin >= kSpins && waitInLine(waiter)) break;
  }
  for (int spin = 0; spin < kSpins && waiter.granted.load(std::memory_order_acquire) == 0; ++spin)
    spinPause();
  if (waiter.granted.load(std::memory_order_acquire) == 0) {
    BlockingScope blocking;
    while (waiter.granted.load(std::memory_order_acquire) == 0)
      waiter.granted.wait(0, std::memory_order_acquire);
  }
  runner_.store(&identity, std::memory_order_relaxed);
  while (head_ != &waiter) runReady(1);
  head_ = waiter.next;
  if (head_ == nullptr) tail_ = nullptr;
  --waiters_;
}

// False when the queue has become free.
bool SerialQueue::waitInLine(Waiter& waiter) {
  uintptr_t state = state_.load(std::memory_order_relaxed);
  do {
    if ((state & kRunning) == 0) return false;
    waiter.next = reinterpret_cast<Node*>(state & ~kFlags);
  } while (!state_.compare_exchange_weak(state, reinterpret_cast<uintptr_t>(&waiter) | (state & kFlags),
                                         std::memory_order_acq_rel, std::memory_order_relaxed));
  return true;
}

// Becomes the running thread, with all that was submitted so far in the list; false when another thread runs.
// Nobody waits in a list that is not being run, so the list then holds work alone. Who was scheduled to come
// keeps that promise by this call: the scheduled flag goes, in the same step, for without it a list must not
// be left behind.
bool SerialQueue::takePending(bool keepsPromise) {
  uintptr_t state = state_.load(std::memory_order_relaxed);
  uintptr_t next;
  do {
    const uintptr_t scheduled = keepsPromise ? 0 : state & kScheduled;
    next = (state & kRunning) != 0 ? (state & ~kScheduled) | scheduled : kRunning | scheduled;
    if (next == state) return false;
  } while (!state_.compare_exchange_weak(state, next, std::memory_order_acq_rel, std::memory_order_relaxed));
  if ((state & kRunning) != 0) return false;  // its thread will see to what is left when it leaves
  runner_.store(&identity, std::memory_order_relaxed);
  append(reinterpret_cast<Node*>(state & ~kFlags));
  return true;
}

// Moves what the state word holds to the list.
void SerialQueue::collect(uintptr_t state) {
  while ((state & ~kFlags) != 0) {
    if (state_.compare_exchange_weak(state, state & kFlags, std::memory_order_acq_rel,
                                     std::memory_order_relaxed)) {
      append(reinterpret_cast<Node*>(state & ~kFlags));
      return;
    }
  }
}

void SerialQueue::append(Node* newestFirst) {
  if (newestFirst == nullptr) return;
  Node* newest = newestFirst;
  Node* oldest = nullptr;
  while (newestFirst != nullptr) {
    waiters_ += newestFirst->isWaiter ? 1 : 0;
    Node* older = newestFirst->next;
    newestFirst->next = oldest;
    oldest = std::exchange(newestFirst, older);
  }
  (head_ == nullptr ? head_ : tail_->next) = oldest;
  tail_ = newest;
}

void SerialQueue::runReady(unsigned most) {
  for (; most > 0 && head_ != nullptr; --most) {
    Node* node = std::exchange(head_, head_->next);
    if (head_ == nullptr) tail_ = nullptr;
    node->task();
    NodeCache::ofThread().recycle(node);
  }
}

void SerialQueue::leave() {
  runner_.store(nullptr, std::memory_order_relaxed);
  uintptr_t state = state_.load(std::memory_order_relaxed);
  if (head_ != nullptr || (state & ~kFlags) != 0 ||
      !state_.compare_exchange_strong(state, state & kScheduled, std::memory_order_acq_rel,
                                      std::memory_order_relaxed))
    leaveWithWork(true);
}

void SerialQueue::leaveWithWork(bool mayDefer) {
  runner_.store(nullptr, std::memory_order_relaxed);
  std::shared_ptr<SerialQueue> self;
  for (;;) {
    uintptr_t state = state_.load(std::memory_order_relaxed);
    collect(state);
    if (waiters_ != 0) return grant();
    state &= kFlags;
    const bool mustSchedule = head_ != nullptr && (state & kScheduled) == 0;
    if (mustSchedule && !self) self = shared_from_this();
    const uintptr_t next = mustSchedule ? kScheduled : state & kScheduled;
    if (state_.compare_exchange_strong(state, next, std::memory_order_acq_rel, std::memory_order_relaxed)) {
      if (mustSchedule) schedule(std::move(self), mayDefer);
      return;
    }
  }
}

// Passes the queue to the first caller that waits. It runs what stands before it in the list itself.
void SerialQueue::grant() {
  Node* node = head_;
  while (!node->isWaiter) node = node->next;
  std::atomic<int>& granted = static_cast<Waiter*>(node)->granted;
  // In one order with notify_one()'s look at whether anybody sleeps: a release alone may become visible after that
  // look, when the waiter has just gone to sleep, and nobody would wake it.
  granted.store(1, std::memory_order_seq_cst);
  granted.notify_one();  // uses the address alone: the waiter may be gone
}

uint64_t SerialQueue::ownerOfThread() noexcept {
  return currentOwner;
}

void SerialQueue::runPending() {
  if (!takePending(true)) return;
  const uint64_t outer = owner_ == 0 ? currentOwner : std::exchange(currentOwner, owner_);
  runReady(kFairShare);
  currentOwner = outer;
  leaveWithWork(false);
}

void SerialQueue::discardPending() {
  if (!takePending(true)) return;
  while (head_ != nullptr) NodeCache::ofThread().recycle(std::exchange(head_, head_->next));
  tail_ = nullptr;
  leaveWithWork(false);
}

Turn::Turn() : outermost_(currentTurn == nullptr) {
  if (!outermost_) return;
  currentTurn = this;
  HeldBack::exchange(this);
}

Turn::~Turn() {
  if (!outermost_) return;
  runDeferred();
  currentTurn = nullptr;
  HeldBack::exchange(nullptr);
}

Turn* Turn::current() noexcept {
  return currentTurn;
}

void Turn::defer(std::shared_ptr<SerialQueue> queue) {
  if (end_ < near_.size()) {
    near_[end_] = std::move(queue);
  } else {
    far_.push_back(std::move(queue));
  }
  ++end_;
}

std::shared_ptr<SerialQueue> Turn::takeFirst() {
  if (!outermost_) return currentTurn->takeFirst();
  if (first_ == end_) return nullptr;
  std::shared_ptr<SerialQueue> queue =
      std::move(first_ < near_.size() ? near_[first_] : far_[first_ - near_.size()]);
  if (++first_ == end_) {
    first_ = end_ = 0;
    far_.clear();
  }
  return queue;
}

void Turn::runDeferred() {
  if (!outermost_) return currentTurn->runDeferred();
  for (unsigned runs = 0; runs < kMostRunsAtEnd; ++runs) {
    const std::shared_ptr<SerialQueue> queue = takeFirst();
    if (!queue) return;
    queue->runPending();
  }
  handDeferredToExecutors();
}

void Turn::handDeferredToExecutors() {
  if (!outermost_) return currentTurn->handDeferredToExecutors();
  if (beforeBlocking_) beforeBlocking_();
  while (std::shared_ptr<SerialQueue> queue = takeFirst()) {
    Executor& executor = queue->executor();
    executor.submit(std::move(queue));
  }
}

void Turn::setBeforeBlocking(Task task) {
  if (!outermost_) return currentTurn->setBeforeBlocking(std::move(task));
  beforeBlocking_ = std::move(task);
}

}  // namespace kyt
