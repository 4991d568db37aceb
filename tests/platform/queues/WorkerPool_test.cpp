// The elastic pool: how many run, who waits, what blocked workers and shut-down do.
#include "platform/queues/WorkerPool.h"
#include "platform/base/Blocking.h"

#include <gtest/gtest.h>
#include <sys/resource.h>
#include <unistd.h>

#include <atomic>
#include <fstream>
#include <mutex>
#include <set>
#include <string>
#include <system_error>
#include <thread>
#include <vector>

#include "platform/base/Counters.h"
#include "platform/base/Semaphore.h"
#include "platform/fake/MemoryLogSink.h"
#include "platform/queues/Log.h"
#include "platform/queues/SerialQueue.h"
#include "tests/support/Eventually.h"
#include "tests/support/Sanitizers.h"

namespace kyt {
namespace {

using namespace std::chrono_literals;
constexpr Duration kDeadline = kTestDeadline;

WorkerPoolOptions options(size_t runnable, size_t most = 512, Duration idleExit = 10s) {
  WorkerPoolOptions result;
  result.runnable = runnable;
  result.maxWorkers = most;
  result.idleExit = idleExit;
  return result;
}

TEST(WorkerPool, RunsWorkOnAThreadOfItsOwn) {
  WorkerPool pool(options(2));
  auto queue = SerialQueue::create("test", pool);
  Semaphore done;
  std::thread::id ranOn;
  queue->async([&] {
    ranOn = std::this_thread::get_id();
    done.signal();
  });
  ASSERT_TRUE(done.waitFor(kDeadline));
  EXPECT_NE(ranOn, std::this_thread::get_id());
}

std::atomic<int> timesQuiet{0};

TEST(WorkerPool, SaysWhenItIsQuiet) {
  WorkerPoolOptions o = options(2);
  o.idleExit = std::chrono::milliseconds(20);
  o.whenQuiet = [] { ++timesQuiet; };
  timesQuiet = 0;
  WorkerPool pool(o);
  auto queue = SerialQueue::create("test", pool);
  for (int round = 1; round <= 3; ++round) {
    Semaphore done;
    queue->async([&] { done.signal(); });
    ASSERT_TRUE(done.waitFor(kDeadline));
    EXPECT_TRUE(eventually([&] { return timesQuiet == round && pool.figures().workers == 0; }));
  }
}

TEST(WorkerPool, SaysOnceThatItIsQuietWhereSeveralWorkersEnd) {
  WorkerPoolOptions o = options(2);
  o.idleExit = std::chrono::milliseconds(20);
  o.whenQuiet = [] { ++timesQuiet; };
  timesQuiet = 0;
  WorkerPool pool(o);
  auto one = SerialQueue::create("one", pool), other = SerialQueue::create("other", pool);
  Semaphore running, goOn;
  for (const auto& queue : {one, other})
    queue->async([&] {
      running.signal();
      goOn.wait();
    });
  ASSERT_TRUE(running.waitFor(kDeadline) && running.waitFor(kDeadline));
  EXPECT_EQ(pool.figures().workers, 2U);
  goOn.signal();
  goOn.signal();
  EXPECT_TRUE(eventually([&] { return pool.figures().workers == 0; }));
  EXPECT_EQ(timesQuiet, 1);
}

// A program that goes on reporting leaves no moment without a worker.
TEST(WorkerPool, SaysThatItIsQuietAlsoWhileOneWorkerGoesOn) {
  WorkerPoolOptions o = options(2);
  o.idleExit = std::chrono::milliseconds(200);
  o.whenQuiet = [] { ++timesQuiet; };
  timesQuiet = 0;
  Semaphore running, goOn, still;  // outlive the workers
  WorkerPool pool(o);
  auto one = SerialQueue::create("one", pool), other = SerialQueue::create("other", pool);
  for (const auto& queue : {one, other})
    queue->async([&] {
      running.signal();
      goOn.wait();
    });
  ASSERT_TRUE(running.waitFor(kDeadline) && running.waitFor(kDeadline));
  goOn.signal();
  other->async([&] {  // keeps its worker, or the other queue's, until the pool is quiet
    running.signal();
    still.wait();
  });
  goOn.signal();
  ASSERT_TRUE(running.waitFor(kDeadline));
  EXPECT_TRUE(eventually([&] { return timesQuiet == 1 && pool.figures().workers == 1; }));
  still.signal();
}

// Work that comes while the last worker says so is done, also where the system refuses another.
TEST(WorkerPool, WorkThatComesWhileItGetsQuietIsDone) {
  static Semaphore quiet, goOn;
  WorkerPoolOptions o = options(2);
  o.maxWorkers = 1;
  o.idleExit = std::chrono::milliseconds(20);
  o.whenQuiet = [] {
    quiet.signal();
    goOn.wait();
  };
  WorkerPool pool(o);
  auto queue = SerialQueue::create("test", pool);
  Semaphore done;
  queue->async([&] { done.signal(); });
  ASSERT_TRUE(done.waitFor(kDeadline));
  ASSERT_TRUE(quiet.waitFor(kDeadline));
  queue->async([&] { done.signal(); });
  goOn.signal();
  EXPECT_TRUE(done.waitFor(kDeadline));
  goOn.signal();  // for the end
}

// A pool whose workers have all ended, and a system that refuses a new one for a while.
TEST(WorkerPool, WorkThatFoundNoThreadRunsAsSoonAsThereIsOne) {
  if (kSanitized) GTEST_SKIP() << "a sanitizer takes more address space than any limit";
  MemoryLogSink sink;
  Log log(sink);
  WorkerPoolOptions o = options(2);
  o.log = &log;
  WorkerPool pool(o);
  auto queue = SerialQueue::create("test", pool);
  rlimit before{};
  ASSERT_EQ(getrlimit(RLIMIT_AS, &before), 0);
  std::thread relief([&] {
    EXPECT_TRUE(eventually([&] { return sink.count("the system refuses a thread") > 0; }));
    setrlimit(RLIMIT_AS, &before);
  });
  size_t pages = 0;
  std::ifstream("/proc/self/statm") >> pages;
  rlimit tight = before;
  tight.rlim_cur = pages * static_cast<size_t>(getpagesize()) + (6u << 20);  // less than a thread's stack
  Semaphore over;
  std::vector<std::thread> others;  // take what stacks the library has kept
  others.reserve(64);
  ASSERT_EQ(setrlimit(RLIMIT_AS, &tight), 0);
  try {
    while (others.size() < 64) others.emplace_back([&] { over.wait(); });
  } catch (const std::system_error&) {
  }
  Semaphore done;
  queue->async([&] { done.signal(); });
  relief.join();
  EXPECT_TRUE(done.waitFor(kDeadline));
  for (size_t i = 0; i < others.size(); ++i) over.signal();
  for (std::thread& other : others) other.join();
}

TEST(WorkerPool, NamesItsThreads) {
  static std::mutex mutex;
  static std::set<std::string> names;
  WorkerPoolOptions o = options(2);
  o.nameThread = [](const char* name) {
    std::lock_guard lock(mutex);
    names.insert(name);
  };
  WorkerPool pool(o);
  auto queue = SerialQueue::create("test", pool);
  Semaphore done;
  queue->async([&] { done.signal(); });
  ASSERT_TRUE(done.waitFor(kDeadline));
  std::lock_guard lock(mutex);
  EXPECT_EQ(names, std::set<std::string>{"kyt-worker-1"});
}

// Fills queues with work that waits, not announced, until told to go on.
struct Holders {
  std::vector<std::shared_ptr<SerialQueue>> queues;
  std::atomic<int> inside{0};
  std::atomic<bool> go{false};
  void add(Executor& executor, int count, uint64_t owner = 0) {
    for (int i = 0; i < count; ++i) {
      queues.push_back(SerialQueue::create("holder", executor, owner));
      queues.back()->async([this] {
        ++inside;
        while (!go) std::this_thread::sleep_for(100us);
        --inside;
      });
    }
  }
};

TEST(WorkerPool, RunsNoMoreAtOnceThanItsLimit) {
  WorkerPool pool(options(3));
  Holders holders;
  holders.add(pool, 8);
  EXPECT_TRUE(eventually([&] { return holders.inside == 3; }));
  EXPECT_EQ(pool.figures().workers, 3u);
  EXPECT_EQ(pool.figures().waitingQueues, 5u);
  holders.go = true;
  EXPECT_TRUE(eventually([&] { return pool.figures().waitingQueues == 0 && holders.inside == 0; }));
  EXPECT_LE(pool.figures().mostWorkers, 3u);
}

TEST(WorkerPool, KeepsOthersRunningWhileWorkersAreBlocked) {
  WorkerPool pool(options(2));
  Semaphore release, blockedDone;
  std::vector<std::shared_ptr<SerialQueue>> queues;
  for (int i = 0; i < 20; ++i) {
    queues.push_back(SerialQueue::create("blocked", pool));
    queues.back()->async([&] {
      release.wait();
      blockedDone.signal();
    });
  }
  EXPECT_TRUE(eventually([&] { return pool.figures().blocked == 20; }));
  Semaphore done;
  auto other = SerialQueue::create("other", pool);
  other->async([&] { done.signal(); });
  EXPECT_TRUE(done.waitFor(kDeadline));
  for (int i = 0; i < 20; ++i) release.signal();
  for (int i = 0; i < 20; ++i) ASSERT_TRUE(blockedDone.waitFor(kDeadline));
  EXPECT_TRUE(eventually([&] { return pool.figures().blocked == 0; }));
}

TEST(WorkerPool, CountsNestedBlockingOnce) {
  WorkerPool pool(options(2));
  auto queue = SerialQueue::create("test", pool);
  Semaphore entered, leave, done;
  queue->async([&] {
    BlockingScope outer;
    { BlockingScope inner; }
    entered.signal();
    leave.wait();
    done.signal();
  });
  ASSERT_TRUE(entered.waitFor(kDeadline));
  EXPECT_EQ(pool.figures().blocked, 1u);
  leave.signal();
  ASSERT_TRUE(done.waitFor(kDeadline));
  EXPECT_TRUE(eventually([&] { return pool.figures().blocked == 0; }));
}

TEST(WorkerPool, NeverHasMoreThreadsThanItsMost) {
  Counters counters;
  WorkerPoolOptions o = options(2, 6);
  o.counters = &counters;
  WorkerPool pool(o);
  Semaphore release;
  std::atomic<int> ran{0};
  std::vector<std::shared_ptr<SerialQueue>> queues;
  for (int i = 0; i < 10; ++i) {
    queues.push_back(SerialQueue::create("blocked", pool));
    queues.back()->async([&] {
      release.wait();
      ++ran;
    });
  }
  EXPECT_TRUE(eventually([&] { return pool.figures().blocked == 6; }));
  EXPECT_EQ(pool.figures().waitingQueues, 4u);
  EXPECT_GT(counters.value(Reason::workersExhausted), 0u);
  for (int i = 0; i < 10; ++i) release.signal();
  EXPECT_TRUE(eventually([&] { return ran == 10; }));
  EXPECT_EQ(pool.figures().mostWorkers, 6u);
}

TEST(WorkerPool, SaysOnceAMinuteThatWorkWaits) {
  Counters counters;
  MemoryLogSink sink;
  Log log(sink, LogLevel::normal);
  WorkerPoolOptions o = options(2, 2);
  o.counters = &counters;
  o.log = &log;
  std::atomic<int> ran{0};
  {
    WorkerPool pool(o);
    Semaphore release;
    std::vector<std::shared_ptr<SerialQueue>> queues;
    for (int i = 0; i < 10; ++i) {
      queues.push_back(SerialQueue::create("blocked", pool));
      queues.back()->async([&] {
        release.wait();
        ++ran;
      });
    }
    EXPECT_TRUE(eventually([&] { return pool.figures().blocked == 2; }));
    for (int i = 0; i < 10; ++i) release.signal();
    EXPECT_TRUE(eventually([&] { return ran == 10; }));
  }
  EXPECT_GT(counters.value(Reason::workersExhausted), 1u);
  EXPECT_EQ(sink.count(LogLevel::normal, "WorkerPool(work): work waits"), 1u);
}

TEST(WorkerPool, LetsOneOwnerHoldHalfOfItsWorkersAndOthersPass) {
  WorkerPool pool(options(2, 8));
  Semaphore release;
  std::mutex mutex;
  std::vector<int> order;
  std::vector<std::shared_ptr<SerialQueue>> queues;
  for (int i = 0; i < 7; ++i) {
    queues.push_back(SerialQueue::create("greedy", pool, 1000));
    queues.back()->async([&, i] {
      {
        std::lock_guard lock(mutex);
        order.push_back(i);
      }
      release.wait();
    });
  }
  EXPECT_TRUE(eventually([&] { return pool.figures().blocked == 4 && pool.figures().waitingQueues == 3; }));
  Semaphore done;
  auto other = SerialQueue::create("other", pool, 1001);
  other->async([&] { done.signal(); });
  ASSERT_TRUE(done.waitFor(kDeadline));
  EXPECT_EQ(pool.figures().blocked, 4u);
  for (int next = 4; next < 7; ++next) {
    release.signal();
    EXPECT_TRUE(eventually([&] {
      std::lock_guard lock(mutex);
      return order.size() == static_cast<size_t>(next) + 1;
    }));
  }
  {
    std::lock_guard lock(mutex);
    EXPECT_EQ(std::vector<int>(order.begin() + 4, order.end()), (std::vector<int>{4, 5, 6}));
  }
  for (int i = 0; i < 4; ++i) release.signal();
  pool.shutDown();
}

TEST(WorkerPool, TellsWhenWorkHasNotEndedInTime) {
  WorkerPool pool(options(1));
  Semaphore begun, release;
  auto queue = SerialQueue::create("slow", pool);
  queue->async([&] {
    begun.signal();
    release.wait();
  });
  ASSERT_TRUE(begun.waitFor(kDeadline));
  EXPECT_FALSE(pool.shutDownWithin(std::chrono::milliseconds(1)));
  release.signal();
  EXPECT_TRUE(pool.shutDownWithin(kDeadline));
  EXPECT_EQ(pool.figures().workers, 0u);
}

TEST(WorkerPool, RunsQueuesInTheOrderOfTheirSubmission) {
  WorkerPool pool(options(1));
  Holders holders;
  holders.add(pool, 1);
  EXPECT_TRUE(eventually([&] { return holders.inside == 1; }));
  std::vector<int> order;
  std::vector<std::shared_ptr<SerialQueue>> queues;
  Semaphore done;
  for (int i = 0; i < 10; ++i) {
    queues.push_back(SerialQueue::create("test", pool));
    queues.back()->async([&, i] {
      order.push_back(i);
      done.signal();
    });
  }
  holders.go = true;
  for (int i = 0; i < 10; ++i) ASSERT_TRUE(done.waitFor(kDeadline));
  EXPECT_EQ(order, (std::vector<int>{0, 1, 2, 3, 4, 5, 6, 7, 8, 9}));
}

TEST(WorkerPool, LetsOwnersTakeTurnsHoweverManyQueuesOneHasMadeReady) {
  WorkerPool pool(options(1));
  Holders holders;
  holders.add(pool, 1);
  EXPECT_TRUE(eventually([&] { return holders.inside == 1; }));
  std::string order;
  std::vector<std::shared_ptr<SerialQueue>> queues;
  Semaphore done;
  const auto submit = [&](uint64_t owner, char name) {
    queues.push_back(SerialQueue::create("test", pool, owner));
    queues.back()->async([&order, &done, name] {
      order += name;
      done.signal();
    });
  };
  for (int i = 0; i < 100; ++i) submit(1000, 'a');
  submit(1001, 'X');
  holders.go = true;
  for (int i = 0; i < 101; ++i) ASSERT_TRUE(done.waitFor(kDeadline));
  EXPECT_EQ(order.substr(0, 2), "aX");
}

TEST(WorkerPool, LetsAQueueWithEndlessWorkTakeTurnsWithOthers) {
  WorkerPool pool(options(1));
  auto endless = SerialQueue::create("endless", pool);
  std::atomic<bool> stop{false};
  struct Again {
    SerialQueue* queue;
    std::atomic<bool>* stop;
    void operator()() {
      if (!*stop) queue->async(Again{queue, stop});
    }
  };
  endless->async(Again{endless.get(), &stop});
  Semaphore done;
  auto other = SerialQueue::create("other", pool);
  other->async([&] { done.signal(); });
  EXPECT_TRUE(done.waitFor(kDeadline));
  stop = true;
  pool.shutDown();
}

TEST(WorkerPool, SaysWhenAsManyQueuesAreReadyAsMayRun) {
  WorkerPoolOptions options;
  options.runnable = 2;
  WorkerPool pool(options);
  EXPECT_FALSE(pool.hasMuchReady());
  std::atomic<bool> release{false};
  std::atomic<int> running{0}, ended{0};
  std::vector<std::shared_ptr<SerialQueue>> queues;
  const auto add = [&] {
    queues.push_back(SerialQueue::create("test", pool));
    queues.back()->async([&] {
      ++running;
      while (!release) std::this_thread::yield();
      ++ended;
    });
  };
  add();
  add();
  ASSERT_TRUE(eventually([&] { return running == 2; }));
  EXPECT_FALSE(pool.hasMuchReady()) << "they run";
  add();
  EXPECT_FALSE(pool.hasMuchReady());
  add();
  EXPECT_TRUE(pool.hasMuchReady());
  release = true;
  ASSERT_TRUE(eventually([&] { return ended == 4; }));
  EXPECT_FALSE(pool.hasMuchReady());
}

TEST(WorkerPool, EndsAllIdleWorkersAndStartsAgain) {
  WorkerPool pool(options(4, 512, 20ms));
  for (int round = 0; round < 2; ++round) {
    Holders holders;
    holders.add(pool, 4);
    EXPECT_TRUE(eventually([&] { return holders.inside == 4; }));
    holders.go = true;
    EXPECT_TRUE(eventually([&] { return pool.figures().workers == 0; }));
  }
}

TEST(WorkerPool, WakesNobodyForAQueueThatGoesOnWithWork) {
  WorkerPool pool(options(4));
  auto queue = SerialQueue::create("test", pool);
  Semaphore done;
  struct Again {
    SerialQueue* queue;
    Semaphore* done;
    int left;
    void operator()() {
      if (left == 0) return done->signal();
      queue->async(Again{queue, done, left - 1});
    }
  };
  queue->async(Again{queue.get(), &done, 1000});
  ASSERT_TRUE(done.waitFor(kDeadline));
  EXPECT_EQ(pool.figures().wakeUps, 1u);
}

TEST(WorkerPool, DestroysPendingWorkAtShutDownAndFinishesWhatRuns) {
  auto token = std::make_shared<int>(0);
  WorkerPool pool(options(1));
  Semaphore entered, leave;
  std::atomic<bool> finished{false};
  auto running = SerialQueue::create("running", pool);
  running->async([&] {
    entered.signal();
    leave.wait();
    finished = true;
  });
  ASSERT_TRUE(entered.waitFor(kDeadline));
  std::atomic<int> ran{0};
  Holders holders;  // keeps the one worker that may run, while the first is blocked
  holders.add(pool, 1);
  EXPECT_TRUE(eventually([&] { return holders.inside == 1; }));
  auto pending = SerialQueue::create("pending", pool);
  pending->async([&ran, token] { ++ran; });
  std::thread releaser([&] {
    leave.signal();
    holders.go = true;
  });
  // Whether the pending queue still ran depends on who was first; it is gone afterwards in any case.
  pool.shutDown();
  releaser.join();
  EXPECT_TRUE(finished);
  EXPECT_EQ(token.use_count(), 1);
  const int before = ran;
  pending->async([&ran, token] { ++ran; });
  EXPECT_EQ(token.use_count(), 1);
  EXPECT_EQ(ran, before);
  EXPECT_EQ(pool.figures().workers, 0u);
  pool.shutDown();  // again: nothing to do
}

// A worker that waits for a queue held by a blocked one announces it, so the pool does not run dry.
TEST(WorkerPool, KeepsOthersRunningWhileASynchronousCallWaits) {
  WorkerPool pool(options(1));
  auto held = SerialQueue::create("held", pool);
  auto caller = SerialQueue::create("caller", pool);
  auto other = SerialQueue::create("other", pool);
  Semaphore entered, leave, called, ran;
  std::thread holder([&] {
    held->sync([&] {
      entered.signal();
      leave.wait();
    });
  });
  ASSERT_TRUE(entered.waitFor(kDeadline));
  caller->async([&] {
    held->sync([] {});
    called.signal();
  });
  EXPECT_TRUE(eventually([&] { return pool.figures().blocked == 1; }));
  other->async([&] { ran.signal(); });
  EXPECT_TRUE(ran.waitFor(kDeadline));
  leave.signal();
  EXPECT_TRUE(called.waitFor(kDeadline));
  holder.join();
}

TEST(WorkerPoolStress, KeepsOrderAndExclusionWithBlockingTurnsAndShutDown) {
  constexpr int kThreads = 6, kQueues = 5, kRounds = 1500;
  std::atomic<int> overlaps{0}, disorders{0};
  struct State {
    std::shared_ptr<SerialQueue> queue;
    std::atomic<int> inside{0};
    int last[kThreads] = {};
  } states[kQueues];
  WorkerPool pool(options(3, 16, 1ms));
  for (int i = 0; i < kQueues; ++i) states[i].queue = SerialQueue::create("stress", pool, i % 3);
  std::atomic<int> ran{0};
  auto step = [&](State& state, int thread, int value) {
    if (state.inside.fetch_add(1) != 0) ++overlaps;
    if (state.last[thread] >= value) ++disorders;
    state.last[thread] = value;
    if (value % 97 == 0) {
      BlockingScope blocking;
      std::this_thread::yield();
    }
    state.inside.fetch_sub(1);
    ++ran;
  };
  std::vector<std::thread> submitters;
  for (int t = 0; t < kThreads; ++t)
    submitters.emplace_back([&, t] {
      for (int i = 1; i <= kRounds; ++i) {
        State& state = states[(i * 7 + t) % kQueues];
        State& second = states[(i * 7 + t + 1) % kQueues];
        if (i % 5 == 0) {
          state.queue->sync([&] { step(state, t, i); });
        } else if (i % 3 == 0) {
          Turn turn;
          state.queue->async([&step, &state, t, i] { step(state, t, i); });
          second.queue->sync([] {});
        } else {
          state.queue->async([&step, &state, t, i] { step(state, t, i); });
        }
      }
    });
  for (auto& thread : submitters) thread.join();
  EXPECT_TRUE(eventually([&] { return ran == kThreads * kRounds; }));
  pool.shutDown();
  EXPECT_EQ(overlaps, 0);
  EXPECT_EQ(disorders, 0);
}

TEST(WorkerPoolStress, ShutsDownWhileOthersSubmit) {
  for (int round = 0; round < 30; ++round) {
    auto pool = std::make_unique<WorkerPool>(options(2, 8));
    auto token = std::make_shared<int>(0);
    std::vector<std::shared_ptr<SerialQueue>> queues;
    for (int i = 0; i < 4; ++i) queues.push_back(SerialQueue::create("test", *pool));
    std::vector<std::thread> submitters;
    for (int t = 0; t < 3; ++t)
      submitters.emplace_back([&] {
        for (int i = 0; i < 300; ++i) queues[i % 4]->async([token] {});
      });
    pool->shutDown();
    for (auto& thread : submitters) thread.join();
    EXPECT_EQ(token.use_count(), 1);
  }
}

}  // namespace
}  // namespace kyt
