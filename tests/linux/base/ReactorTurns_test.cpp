// Work that the reactor's own threads run: when they do, and that waiting for events goes on meanwhile.
#include <dirent.h>
#include <gtest/gtest.h>
#include <pthread.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <atomic>
#include <fstream>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "platform/base/Blocking.h"
#include "platform/base/Semaphore.h"
#include "platform/fake/ManualExecutor.h"
#include "platform/linux/base/Descriptors.h"
#include "platform/linux/base/EpollReactor.h"
#include "platform/linux/base/Threads.h"
#include "platform/queues/SerialQueue.h"
#include "platform/queues/WorkerPool.h"
#include "tests/support/Eventually.h"

namespace kyt {
namespace {

using namespace std::chrono_literals;

bool onReactorThread() {
  char name[16] = "";
  pthread_getname_np(pthread_self(), name, sizeof name);
  return std::string(name) == "kyt-reactor";
}

// A descriptor whose signals reach a queue as work.
class Source {
 public:
  Source(EpollReactor& reactor, Executor& executor, std::function<void()> work) {
    // What waits in the queue outlives us.
    auto shared = std::make_shared<std::function<void()>>(std::move(work));
    watch_ = reactor.watch(event_.get(), ready::readable | ready::edgeTriggered,
                           [queue = SerialQueue::create("source", executor), shared](unsigned) {
                             queue->async([shared] { (*shared)(); });
                           });
  }
  void signal() { signalEventDescriptor(event_.get()); }

 private:
  Descriptor event_ = makeEventDescriptor();
  Watch watch_;
};

class ReactorTurns : public testing::Test {
 protected:
  ~ReactorTurns() override {
    reactor_->stop();
    pool_.shutDown();
  }
  // Signals a source of short work, one after the other, until its work runs on the reactor's thread.
  [[nodiscard]] bool warmUp() {
    std::atomic<int> runs{0};
    std::atomic<bool> there{false};
    Source source(*reactor_, pool_, [&] {
      if (onReactorThread()) there = true;
      ++runs;
    });
    return eventually([&] {
      const int before = runs;
      source.signal();
      return eventually([&] { return runs > before; }) && there;
    });
  }
  // Signals it until a piece of its work has run on the reactor's thread; `work` says what that piece does.
  [[nodiscard]] bool runThere(const std::function<void()>& work) {
    std::atomic<int> runs{0};
    auto once = std::make_shared<std::atomic<bool>>(false);
    sources_.push_back(std::make_unique<Source>(*reactor_, pool_, [&runs, once, work] {
      if (*once) return;
      if (!onReactorThread()) {
        ++runs;
        return;
      }
      *once = true;
      work();
    }));
    Source& source = *sources_.back();
    return eventually([&] {
      if (*once) return true;
      const int before = runs;
      source.signal();
      return eventually([&] { return runs > before || *once; }) && *once;
    });
  }
  WorkerPoolOptions poolOptions() {
    WorkerPoolOptions options;
    options.nameThread = beginServiceThread;
    return options;
  }

  WorkerPool pool_{poolOptions()};
  std::unique_ptr<EpollReactor> reactor_ = EpollReactor::create();
  std::vector<std::unique_ptr<Source>> sources_;
};

TEST_F(ReactorTurns, RunFrequentShortWorkWithoutAWorker) {
  ASSERT_TRUE(warmUp());
  // Where the machine is busy, short work may take long enough to need one more for a moment.
  EXPECT_TRUE(eventually([&] { return reactor_->threads() == 2U; }))
      << "one that leads and one that stands by";
}

TEST_F(ReactorTurns, LeaveRareWorkToTheExecutor) {
  std::atomic<bool> ran{false}, there{false};
  Source source(*reactor_, pool_, [&] {
    there = onReactorThread();
    ran = true;
  });
  source.signal();
  EXPECT_TRUE(eventually([&] { return ran.load(); }));
  EXPECT_FALSE(there);
  EXPECT_EQ(reactor_->threads(), 1u);
}

TEST_F(ReactorTurns, LeaveQueuesAloneWhoseExecutorLendsNone) {
  ASSERT_TRUE(warmUp());
  ManualExecutor manual;
  std::atomic<int> ran{0};
  Source source(*reactor_, manual, [&] { ++ran; });
  source.signal();
  EXPECT_TRUE(eventually([&] { return manual.pending() == 1; }));
  EXPECT_EQ(ran, 0);
  manual.runAll();
  EXPECT_EQ(ran, 1);
}

TEST_F(ReactorTurns, LetEventsPassWhileTheirWorkBlocks) {
  Semaphore release;
  std::atomic<bool> finished{false};
  ASSERT_TRUE(runThere([&] {
    release.wait();
    finished = true;
  }));
  std::atomic<int> ran{0};
  Source other(*reactor_, pool_, [&] { ++ran; });
  for (int i = 0; i < 20; ++i) {
    const int before = ran;
    other.signal();
    ASSERT_TRUE(eventually([&] { return ran > before; }));
  }
  EXPECT_FALSE(finished);
  release.signal();
  EXPECT_TRUE(eventually([&] { return finished.load(); }));
  EXPECT_TRUE(eventually([&] { return reactor_->threads() <= 2; }));
}

TEST_F(ReactorTurns, LetEventsPassWhileTheirWorkTakesLong) {
  std::atomic<bool> go{false}, finished{false};
  ASSERT_TRUE(runThere([&] {
    while (!go) std::this_thread::yield();
    finished = true;
  }));
  std::atomic<int> ran{0};
  Source other(*reactor_, pool_, [&] { ++ran; });
  other.signal();
  EXPECT_TRUE(eventually([&] { return ran == 1; }));
  EXPECT_FALSE(finished);
  go = true;
  EXPECT_TRUE(eventually([&] { return finished.load() && reactor_->threads() <= 2; }));
}

TEST_F(ReactorTurns, LetEventsPassHoweverManyPiecesOfWorkBlock) {
  constexpr int kBlockers = 8;  // more than the reactor has threads: workers take the others
  Semaphore release;
  std::atomic<int> entered{0}, finished{0}, ran{0};
  Source other(*reactor_, pool_, [&] { ++ran; });
  for (int i = 0; i < kBlockers; ++i) {
    sources_.push_back(std::make_unique<Source>(*reactor_, pool_, [&] {
      ++entered;
      release.wait();
      ++finished;
    }));
    sources_.back()->signal();
    ASSERT_TRUE(eventually([&] { return entered == i + 1; }));
    for (int events = 0; events < 20; ++events) {
      const int before = ran;
      other.signal();
      ASSERT_TRUE(eventually([&] { return ran > before; }));
    }
  }
  EXPECT_LE(reactor_->threads(), 4u);
  for (int i = 0; i < kBlockers; ++i) release.signal();
  EXPECT_TRUE(eventually([&] { return finished == kBlockers && reactor_->threads() <= 2; }));
}

TEST_F(ReactorTurns, MakeAShutDownOfTheExecutorWait) {
  std::atomic<bool> go{false}, finished{false};
  ASSERT_TRUE(runThere([&] {
    while (!go) std::this_thread::yield();
    finished = true;
  }));
  std::thread releaser([&] { go = true; });
  pool_.shutDown();
  EXPECT_TRUE(finished);
  releaser.join();
}

long switchesOfReactorThreads() {
  long switches = 0;
  const std::string tasks = "/proc/self/task/";
  DIR* folder = opendir(tasks.c_str());
  while (const dirent* entry = readdir(folder)) {
    std::ifstream comm(tasks + entry->d_name + "/comm");
    std::string name;
    if (!std::getline(comm, name) || name != "kyt-reactor") continue;
    std::ifstream status(tasks + entry->d_name + "/status");
    for (std::string line; std::getline(status, line);)
      if (line.rfind("voluntary_ctxt_switches:", 0) == 0) switches += std::stol(line.substr(24));
  }
  closedir(folder);
  return switches;
}

TEST_F(ReactorTurns, AreWatchedNoLongerOnceNothingHappens) {
  ASSERT_TRUE(warmUp());
  long last = -1;
  auto since = std::chrono::steady_clock::now();
  EXPECT_TRUE(eventually([&] {
    const long now = switchesOfReactorThreads();
    if (now != last) since = std::chrono::steady_clock::now();
    last = now;
    return std::chrono::steady_clock::now() - since > 100ms;  // ten ticks without one
  }));
}

TEST_F(ReactorTurns, KeepEachSourcesOrderUnderLoad) {
  constexpr int kSources = 6, kSignals = 300;
  struct State {
    std::shared_ptr<SerialQueue> queue;
    Descriptor event = makeEventDescriptor();
    std::atomic<int> inside{0};
    std::atomic<uint64_t> seen{0};
    Watch watch;
  };
  std::vector<State> states(kSources);
  std::atomic<int> overlaps{0};
  for (int i = 0; i < kSources; ++i) {
    State& state = states[static_cast<size_t>(i)];
    state.queue = SerialQueue::create("source", pool_);
    state.watch = reactor_->watch(state.event.get(), ready::readable | ready::edgeTriggered,
                                  [&state, &overlaps, i](unsigned) {
                                    state.queue->async([&state, &overlaps, i] {
                                      if (state.inside.fetch_add(1) != 0) ++overlaps;
                                      eventfd_t value = 0;
                                      if (eventfd_read(state.event.get(), &value) == 0) state.seen += value;
                                      if (i % 3 == 0 && state.seen % 7 == 0) {
                                        BlockingScope blocking;
                                        std::this_thread::yield();
                                      }
                                      state.inside.fetch_sub(1);
                                    });
                                  });
  }
  std::vector<std::thread> signallers;
  for (State& state : states)
    signallers.emplace_back([&state] {
      for (int i = 0; i < kSignals; ++i) {
        signalEventDescriptor(state.event.get());
        if (i % 8 == 0) std::this_thread::sleep_for(50us);
      }
    });
  for (auto& thread : signallers) thread.join();
  for (State& state : states) EXPECT_TRUE(eventually([&] { return state.seen == kSignals; }));
  EXPECT_EQ(overlaps, 0);
  for (State& state : states) state.watch.cancel();
  reactor_->stop();
  pool_.shutDown();
}

TEST(ReactorTurnsStress, StopWhileWorkRuns) {
  for (int round = 0; round < 20; ++round) {
    WorkerPool pool{WorkerPoolOptions{}};
    auto reactor = EpollReactor::create();
    std::atomic<int> runs{0};
    std::atomic<bool> stop{false};
    Source source(*reactor, pool, [&] {
      if (++runs % 5 == 0) {
        BlockingScope blocking;
        std::this_thread::yield();
      }
    });
    std::thread signaller([&] {
      while (!stop) {
        source.signal();
        std::this_thread::yield();
      }
    });
    EXPECT_TRUE(eventually([&] { return runs > 30; }));
    reactor->stop();
    const uint64_t after = reactor->wakeUps();
    stop = true;
    signaller.join();
    pool.shutDown();
    EXPECT_EQ(reactor->wakeUps(), after);
    EXPECT_EQ(reactor->threads(), 0u);
  }
}

}  // namespace
}  // namespace kyt
