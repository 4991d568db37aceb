// What serial queues cost: a synchronous call on an idle queue, asynchronous work in a turn, and the way
// through the pool. Each stands beside the plainest means for the same: a mutex, a call through a Task, two
// threads that wake each other by condition variable.

#include <condition_variable>
#include <mutex>
#include <thread>

#include "bench/Measure.h"
#include "platform/base/Semaphore.h"
#include "platform/fake/ManualExecutor.h"
#include "platform/queues/SerialQueue.h"
#include "platform/queues/WorkerPool.h"

namespace kyt {
namespace {

// A second thread that exists: without one, the C library and the reference counts skip their atomic
// operations.
struct OtherThread {
  Semaphore end;
  std::thread thread{[this] { end.wait(); }};
  ~OtherThread() {
    end.signal();
    thread.join();
  }
};

void referenceMutex(bench::Rounds& rounds) {
  OtherThread other;
  std::mutex mutex;
  int value = 0;
  while (rounds.more()) {
    mutex.lock();
    bench::keep(++value);
    mutex.unlock();
  }
}
KYT_MEASURE(referenceMutex);

void syncOnAnIdleQueue(bench::Rounds& rounds) {
  OtherThread other;
  ManualExecutor executor;
  auto queue = SerialQueue::create("bench", executor);
  int value = 0;
  while (rounds.more()) queue->sync([&] { bench::keep(++value); });
}
KYT_MEASURE(syncOnAnIdleQueue);

void referenceTaskCall(bench::Rounds& rounds) {
  OtherThread other;
  int value = 0;
  while (rounds.more()) {
    Task task = [&value] { bench::keep(++value); };
    bench::keep(task);
    task();
  }
}
KYT_MEASURE(referenceTaskCall);

// One event of a batch: the count is read, the record appended asynchronously; the next read runs the append.
void asyncAndSyncInATurn(bench::Rounds& rounds) {
  OtherThread other;
  ManualExecutor executor;
  auto queue = SerialQueue::create("bench", executor);
  int value = 0;
  Turn turn;
  while (rounds.more()) {
    queue->sync([&] { bench::keep(value); });
    queue->async([&value] { ++value; });
  }
}
KYT_MEASURE(asyncAndSyncInATurn);

void turnsOf50Asyncs(bench::Rounds& rounds) {
  OtherThread other;
  ManualExecutor executor;
  auto queue = SerialQueue::create("bench", executor);
  int value = 0;
  while (rounds.more()) {
    Turn turn;
    for (int i = 0; i < 50; ++i) queue->async([&value] { bench::keep(++value); });
  }
  rounds.setItems(rounds.count() * 50);
}
KYT_MEASURE(turnsOf50Asyncs);

void referenceConditionRoundTrip(bench::Rounds& rounds) {
  std::mutex mutex;
  std::condition_variable changed;
  int turn = 0;  // 0: ours, 1: the other's, 2: the end
  std::thread other([&] {
    std::unique_lock lock(mutex);
    for (;;) {
      changed.wait(lock, [&] { return turn != 0; });
      if (turn == 2) return;
      turn = 0;
      changed.notify_all();
    }
  });
  while (rounds.more()) {
    std::unique_lock lock(mutex);
    turn = 1;
    changed.notify_all();
    changed.wait(lock, [&] { return turn == 0; });
  }
  {
    std::lock_guard lock(mutex);
    turn = 2;
  }
  changed.notify_all();
  other.join();
}
KYT_MEASURE(referenceConditionRoundTrip);

void submitToRunAndBack(bench::Rounds& rounds) {
  WorkerPool pool{WorkerPoolOptions{}};
  auto queue = SerialQueue::create("bench", pool);
  Semaphore done;
  while (rounds.more()) {
    queue->async([&] { done.signal(); });
    done.wait();
  }
  rounds.addFigure("wake-ups",
                   static_cast<double>(pool.figures().wakeUps) / static_cast<double>(rounds.count()));
}
KYT_MEASURE(submitToRunAndBack);

}  // namespace
}  // namespace kyt
