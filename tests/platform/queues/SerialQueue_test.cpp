// Serial queues and turns: who runs what, in which order, on which thread.
#include "platform/queues/SerialQueue.h"

#include <gtest/gtest.h>
#include <malloc.h>

#include <atomic>
#include <string>
#include <thread>
#include <vector>

#include "platform/base/Semaphore.h"
#include "platform/fake/ManualExecutor.h"

namespace kyt {
namespace {

class SerialQueueTest : public testing::Test {
 protected:
  std::shared_ptr<SerialQueue> makeQueue(const char* label = "test") {
    return SerialQueue::create(label, executor_);
  }
  Task note(std::string text) {
    return [this, text = std::move(text)] { notes_.push_back(text); };
  }
  using Notes = std::vector<std::string>;
  ManualExecutor executor_;
  Notes notes_;
};

TEST_F(SerialQueueTest, RunsASynchronousCallOnAnIdleQueueOnTheCallersThread) {
  auto queue = makeQueue();
  const auto here = std::this_thread::get_id();
  EXPECT_EQ(queue->sync([] { return std::this_thread::get_id(); }), here);
  EXPECT_EQ(executor_.pending(), 0u);
}

TEST_F(SerialQueueTest, RunsPendingWorkBeforeASynchronousCall) {
  auto queue = makeQueue();
  queue->async(note("a"));
  queue->async(note("b"));
  queue->sync([&] { notes_.push_back("c"); });
  EXPECT_EQ(notes_, (Notes{"a", "b", "c"}));
}

TEST_F(SerialQueueTest, AsksTheExecutorOnceForAnyNumberOfPiecesOfWork) {
  auto queue = makeQueue();
  for (int i = 0; i < 5; ++i) queue->async(note(std::to_string(i)));
  EXPECT_EQ(executor_.pending(), 1u);
  EXPECT_TRUE(notes_.empty());
  EXPECT_EQ(executor_.runAll(), 1u);
  EXPECT_EQ(notes_, (Notes{"0", "1", "2", "3", "4"}));
}

TEST_F(SerialQueueTest, AsksTheExecutorAgainAfterASynchronousCallTookTheWork) {
  auto queue = makeQueue();
  queue->async(note("a"));
  queue->sync([] {});
  executor_.runAll();
  queue->async(note("b"));
  EXPECT_EQ(executor_.pending(), 1u);
  executor_.runAll();
  EXPECT_EQ(notes_, (Notes{"a", "b"}));
}

TEST_F(SerialQueueTest, SubmitsWorkThatASynchronousCallLeftBehind) {
  auto queue = makeQueue();
  queue->sync([&] { queue->async(note("later")); });
  EXPECT_TRUE(notes_.empty());
  EXPECT_EQ(executor_.pending(), 1u);
  executor_.runAll();
  EXPECT_EQ(notes_, (Notes{"later"}));
}

TEST_F(SerialQueueTest, LeavesWhatComesDuringARunToTheNextOne) {
  auto queue = makeQueue();
  queue->async([&] { queue->async(note("second")); });
  EXPECT_TRUE(executor_.runOne());
  EXPECT_TRUE(notes_.empty());
  EXPECT_TRUE(executor_.runOne());
  EXPECT_EQ(notes_, (Notes{"second"}));
}

TEST_F(SerialQueueTest, HandsItsThreadBackAfterAFairShare) {
  auto queue = makeQueue();
  unsigned runs = 0;
  for (unsigned i = 0; i < SerialQueue::kFairShare + 1; ++i) queue->async([&] { ++runs; });
  executor_.runOne();
  EXPECT_EQ(runs, SerialQueue::kFairShare);
  executor_.runOne();
  EXPECT_EQ(runs, SerialQueue::kFairShare + 1);
}

TEST_F(SerialQueueTest, KeepsTheOrderWhenASynchronousCallFollowsAnUnfinishedShare) {
  auto queue = makeQueue();
  std::vector<unsigned> order;
  for (unsigned i = 0; i < SerialQueue::kFairShare + 2; ++i)
    queue->async([&order, i] { order.push_back(i); });
  executor_.runOne();
  queue->async([&order] { order.push_back(SerialQueue::kFairShare + 2); });
  queue->sync([&] { order.push_back(SerialQueue::kFairShare + 3); });
  ASSERT_EQ(order.size(), SerialQueue::kFairShare + 4);
  for (unsigned i = 0; i < order.size(); ++i) EXPECT_EQ(order[i], i);
}

TEST_F(SerialQueueTest, KnowsWhetherTheCallerRunsIt) {
  auto queue = makeQueue();
  auto other = makeQueue();
  EXPECT_FALSE(queue->isCurrent());
  queue->sync([&] {
    EXPECT_TRUE(queue->isCurrent());
    queue->assertCurrent();
    EXPECT_FALSE(other->isCurrent());
    other->sync([&] { EXPECT_TRUE(queue->isCurrent()); });
    std::thread([&] { EXPECT_FALSE(queue->isCurrent()); }).join();
  });
  queue->async([&] { EXPECT_TRUE(queue->isCurrent()); });
  executor_.runAll();
  EXPECT_FALSE(queue->isCurrent());
}

TEST_F(SerialQueueTest, IsOneBlockOfAtMost96Bytes) {
  auto queue = makeQueue();
  // After the counts.
  const void* block = reinterpret_cast<const std::byte*>(queue.get()) - 2 * sizeof(void*);
#if !defined(__SANITIZE_ADDRESS__) && !defined(__SANITIZE_THREAD__) && !defined(__has_feature)
  EXPECT_LE(malloc_usable_size(const_cast<void*>(block)), 96u + sizeof(void*));
#endif
  EXPECT_NE(block, nullptr);
  EXPECT_LE(sizeof(SerialQueue), 80u);
}

TEST_F(SerialQueueTest, DestroysPendingWorkUnrunWithItsExecutor) {
  auto token = std::make_shared<int>(0);
  {
    ManualExecutor executor;
    auto queue = SerialQueue::create("test", executor);
    queue->async([token] { FAIL(); });
    executor.shutDown();
    EXPECT_EQ(token.use_count(), 1);
    queue->async([token] { FAIL(); });
    EXPECT_EQ(token.use_count(), 1);
    EXPECT_EQ(queue->sync([] { return 7; }), 7);
  }
  EXPECT_EQ(token.use_count(), 1);
}

TEST_F(SerialQueueTest, IsKeptAliveByPendingWork) {
  std::weak_ptr<SerialQueue> seen;
  {
    auto queue = makeQueue();
    seen = queue;
    queue->async(note("a"));
  }
  EXPECT_FALSE(seen.expired());
  executor_.runAll();
  EXPECT_TRUE(seen.expired());
  EXPECT_EQ(notes_, (Notes{"a"}));
}

TEST_F(SerialQueueTest, DestroysWorkOnTheQueueBeforeTheNextPieceRuns) {
  auto queue = makeQueue();
  struct AtEnd {
    Notes* notes;
    SerialQueue* queue;
    AtEnd(Notes* n, SerialQueue* q) : notes(n), queue(q) {}
    AtEnd(AtEnd&& o) noexcept : notes(std::exchange(o.notes, nullptr)), queue(o.queue) {}
    ~AtEnd() {
      if (notes != nullptr) notes->push_back(queue->isCurrent() ? "destroyed" : "destroyed elsewhere");
    }
  };
  queue->async([this, atEnd = AtEnd(&notes_, queue.get())] { notes_.push_back("run"); });
  queue->async(note("next"));
  executor_.runAll();
  EXPECT_EQ(notes_, (Notes{"run", "destroyed", "next"}));
}

TEST_F(SerialQueueTest, MakesASynchronousCallWaitForTheThreadThatRunsIt) {
  auto queue = makeQueue();
  Semaphore entered, mayLeave;
  std::atomic<bool> left{false};
  std::thread holder([&] {
    queue->sync([&] {
      entered.signal();
      mayLeave.wait();
      left = true;
    });
  });
  entered.wait();
  std::thread other([&] { queue->sync([&] { EXPECT_TRUE(left.load()); }); });
  mayLeave.signal();
  holder.join();
  other.join();
  EXPECT_EQ(executor_.pending(), 0u);
}

TEST_F(SerialQueueTest, LetsAWaitingSynchronousCallRunTheWorkBeforeIt) {
  auto queue = makeQueue();
  Semaphore entered, mayLeave;
  std::thread holder([&] {
    queue->sync([&] {
      entered.signal();
      mayLeave.wait();
    });
  });
  entered.wait();
  std::thread::id ranOn;
  queue->async([&] { ranOn = std::this_thread::get_id(); });
  std::thread other([&] {
    const auto here = std::this_thread::get_id();
    queue->sync([&] { EXPECT_EQ(ranOn, here); });
  });
  // The holder leaves when the other thread stands in line, or before: then the executor was asked.
  mayLeave.signal();
  other.join();
  holder.join();
}

TEST(SerialQueueDeathTest, ReportsASynchronousCallOntoItself) {
  testing::GTEST_FLAG(death_test_style) = "threadsafe";
  EXPECT_DEATH(
      {
        ManualExecutor executor;
        auto queue = SerialQueue::create("mine", executor);
        queue->sync([&] { queue->sync([] {}); });
      },
      "called from the queue \"mine\" onto itself");
}

class TurnTest : public SerialQueueTest {};

TEST_F(TurnTest, RunsWhatItWasGivenAtItsEndOnItsThread) {
  auto queue = makeQueue();
  {
    Turn turn;
    queue->async(note("a"));
    notes_.push_back("turn");
    EXPECT_EQ(executor_.pending(), 0u);
  }
  EXPECT_EQ(notes_, (Notes{"turn", "a"}));
  EXPECT_EQ(executor_.pending(), 0u);
  EXPECT_EQ(Turn::current(), nullptr);
}

TEST_F(TurnTest, LeavesWorkBesideItToTheExecutorAtOnce) {
  const auto queue = makeQueue();
  {
    const Turn turn;
    queue->asyncBeside(note("beside"));
    EXPECT_EQ(executor_.pending(), 1u);
  }
  EXPECT_TRUE(notes_.empty());
  executor_.runAll();
  EXPECT_EQ(notes_, Notes{"beside"});
}

TEST_F(TurnTest, LeavesWorkToASynchronousCallThatComesFirst) {
  auto queue = makeQueue();
  Turn turn;
  queue->async(note("a"));
  queue->sync([&] { notes_.push_back("b"); });
  queue->async(note("c"));
  EXPECT_EQ(notes_, (Notes{"a", "b"}));
  turn.runDeferred();
  EXPECT_EQ(notes_, (Notes{"a", "b", "c"}));
  EXPECT_EQ(executor_.pending(), 0u);
}

TEST_F(TurnTest, JoinsTheOuterTurn) {
  auto queue = makeQueue();
  {
    Turn outer;
    {
      Turn inner;
      queue->async(note("a"));
      EXPECT_EQ(Turn::current(), &outer);
    }
    notes_.push_back("outer");
  }
  EXPECT_EQ(notes_, (Notes{"outer", "a"}));
}

TEST_F(TurnTest, RunsQueuesInTheOrderInWhichTheyWereGivenWork) {
  std::vector<std::shared_ptr<SerialQueue>> queues;
  Notes expected;
  {
    Turn turn;
    for (int i = 0; i < 20; ++i) {
      queues.push_back(makeQueue());
      queues.back()->async(note(std::to_string(i)));
      expected.push_back(std::to_string(i));
    }
  }
  EXPECT_EQ(notes_, expected);
}

TEST_F(TurnTest, RunsWhatDeferredWorkSubmitsToOtherQueues) {
  auto first = makeQueue();
  auto second = makeQueue();
  {
    Turn turn;
    first->async([&] { second->async(note("second")); });
  }
  EXPECT_EQ(notes_, (Notes{"second"}));
  EXPECT_EQ(executor_.pending(), 0u);
}

TEST_F(TurnTest, HandsOverToTheExecutorWhenQueuesKeepGivingEachOtherWork) {
  auto first = makeQueue();
  auto second = makeQueue();
  struct PingPong {
    std::shared_ptr<SerialQueue> to, from;
    std::atomic<int>* left;
    void operator()() {
      if (--*left > 0) to->async(PingPong{from, to, left});
    }
  };
  std::atomic<int> left{1000};
  {
    Turn turn;
    first->async(PingPong{second, first, &left});
  }
  EXPECT_GT(left.load(), 0);
  EXPECT_EQ(executor_.pending(), 1u);
  executor_.runAll();
  EXPECT_EQ(left.load(), 0);
}

TEST_F(TurnTest, HandsItsQueuesToTheExecutorBeforeItWaits) {
  auto queue = makeQueue();
  Semaphore ran;
  std::thread worker;
  {
    Turn turn;
    queue->async([&] { ran.signal(); });
    // Another thread must get the queue while this one waits inside its turn.
    worker = std::thread([&] {
      while (!executor_.runOne()) std::this_thread::yield();
    });
    EXPECT_TRUE(ran.waitFor(std::chrono::seconds(30)));
  }
  worker.join();
}

// Every submitter's work runs in its order, and never two pieces at once.
TEST(SerialQueueStress, KeepsEachSubmittersOrderAndNeverOverlaps) {
  constexpr int kThreads = 8, kQueues = 3, kRounds = 4000;
  ManualExecutor executor;
  struct State {
    std::shared_ptr<SerialQueue> queue;
    std::atomic<int> inside{0};
    int last[kThreads] = {};  // guarded by the queue
    int total = 0;
  } states[kQueues];
  for (State& state : states) state.queue = SerialQueue::create("stress", executor);
  std::atomic<int> overlaps{0}, disorders{0};
  std::atomic<bool> stop{false};
  auto step = [&](State& state, int thread, int value) {
    if (state.inside.fetch_add(1) != 0) ++overlaps;
    if (state.last[thread] >= value) ++disorders;
    state.last[thread] = value;
    ++state.total;
    state.inside.fetch_sub(1);
  };
  std::vector<std::thread> drainers, submitters;
  for (int i = 0; i < 2; ++i)
    drainers.emplace_back([&] {
      while (!stop || executor.pending() != 0)
        if (!executor.runOne()) std::this_thread::yield();
    });
  for (int t = 0; t < kThreads; ++t)
    submitters.emplace_back([&, t] {
      for (int i = 1; i <= kRounds; ++i) {
        State& state = states[(i + t) % kQueues];
        if (t % 2 == 0 && i % 16 < 8) {
          Turn turn;
          state.queue->async([&step, &state, t, i] { step(state, t, i); });
        } else if (i % 3 == 0) {
          state.queue->sync([&] { step(state, t, i); });
        } else {
          state.queue->async([&step, &state, t, i] { step(state, t, i); });
        }
      }
    });
  for (auto& thread : submitters) thread.join();
  stop = true;
  for (auto& thread : drainers) thread.join();
  int total = 0;
  for (State& state : states) state.queue->sync([&] { total += state.total; });
  EXPECT_EQ(overlaps, 0);
  EXPECT_EQ(disorders, 0);
  EXPECT_EQ(total, kThreads * kRounds);
}

}  // namespace
}  // namespace kyt
