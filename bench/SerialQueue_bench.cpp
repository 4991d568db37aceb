// What serial queues cost: a synchronous call on an idle queue, asynchronous work in a turn, and the way
// through the pool. Each stands beside the plainest means for the same: a mutex, a call through a Task, two
// threads that wake each other by condition variable.
#include <benchmark/benchmark.h>

#include <condition_variable>
#include <mutex>
#include <thread>

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

void referenceMutex(benchmark::State& state) {
  OtherThread other;
  std::mutex mutex;
  int value = 0;
  for (auto _ : state) {
    mutex.lock();
    benchmark::DoNotOptimize(++value);
    mutex.unlock();
  }
}
BENCHMARK(referenceMutex);

void syncOnAnIdleQueue(benchmark::State& state) {
  OtherThread other;
  ManualExecutor executor;
  auto queue = SerialQueue::create("bench", executor);
  int value = 0;
  for (auto _ : state) queue->sync([&] { benchmark::DoNotOptimize(++value); });
}
BENCHMARK(syncOnAnIdleQueue);

void referenceTaskCall(benchmark::State& state) {
  OtherThread other;
  int value = 0;
  for (auto _ : state) {
    Task task = [&value] { benchmark::DoNotOptimize(++value); };
    benchmark::DoNotOptimize(task);
    task();
  }
}
BENCHMARK(referenceTaskCall);

// One event of a batch: the count is read, the record appended asynchronously; the next read runs the append.
void asyncAndSyncInATurn(benchmark::State& state) {
  OtherThread other;
  ManualExecutor executor;
  auto queue = SerialQueue::create("bench", executor);
  int value = 0;
  Turn turn;
  for (auto _ : state) {
    queue->sync([&] { benchmark::DoNotOptimize(value); });
    queue->async([&value] { ++value; });
  }
}
BENCHMARK(asyncAndSyncInATurn);

void turnsOf50Asyncs(benchmark::State& state) {
  OtherThread other;
  ManualExecutor executor;
  auto queue = SerialQueue::create("bench", executor);
  int value = 0;
  for (auto _ : state) {
    Turn turn;
    for (int i = 0; i < 50; ++i) queue->async([&value] { benchmark::DoNotOptimize(++value); });
  }
  state.SetItemsProcessed(state.iterations() * 50);
}
BENCHMARK(turnsOf50Asyncs);

void referenceConditionRoundTrip(benchmark::State& state) {
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
  for (auto _ : state) {
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
BENCHMARK(referenceConditionRoundTrip)->UseRealTime();

void submitToRunAndBack(benchmark::State& state) {
  WorkerPool pool{WorkerPoolOptions{}};
  auto queue = SerialQueue::create("bench", pool);
  Semaphore done;
  for (auto _ : state) {
    queue->async([&] { done.signal(); });
    done.wait();
  }
  state.counters["wake-ups"] =
      benchmark::Counter(static_cast<double>(pool.figures().wakeUps), benchmark::Counter::kAvgIterations);
}
BENCHMARK(submitToRunAndBack)->UseRealTime();

}  // namespace
}  // namespace kyt

BENCHMARK_MAIN();
