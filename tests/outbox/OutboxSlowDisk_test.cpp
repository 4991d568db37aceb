// The outbox with threads, and a disk that takes as long as the test says.
#include <gtest/gtest.h>

#include "outbox/Outbox.h"
#include "platform/base/Limits.h"
#include "platform/base/Semaphore.h"
#include "platform/fake/FakePostStore.h"
#include "platform/queues/WorkerPool.h"
#include "tests/support/TestPlatform.h"

namespace kyt {
namespace {

using std::chrono::seconds;

class StuckPostStore : public FakePostStore {
 public:
  using FakePostStore::FakePostStore;
  [[nodiscard]] std::optional<PostStoreProblem> change(std::span<const StoredPost* const> added,
                                                       std::span<const int64_t> removed,
                                                       bool forGood) override {
    if (isStuck) {
      began.signal();
      goesOn.wait();
    }
    return FakePostStore::change(added, removed, forGood);
  }
  std::atomic<bool> isStuck{false};
  Semaphore began, goesOn;
};

class OutboxOnASlowDisk : public testing::Test {
 protected:
  // One for the disk, one for all else, as in the daemon.
  static WorkerPoolOptions workers() {
    WorkerPoolOptions options;
    options.runnable = options.maxWorkers = 2;
    options.mostOfOneOwner = 1;
    return options;
  }
  struct Outcome {
    Semaphore told;
    bool isKept = false;
  };
  std::shared_ptr<Outcome> keep(uint32_t user) {
    auto outcome = std::make_shared<Outcome>();
    FailedPost failed;
    failed.post.user = user;
    failed.post.url = "https://events.example.org/v1";
    failed.post.body = Data(std::string_view("body"));
    failed.isUnanswered = true;
    outbox_->keep(std::move(failed), [outcome](bool isKept) {
      outcome->isKept = isKept;
      outcome->told.signal();
    });
    return outcome;
  }
  static bool isTold(Outcome& outcome) { return outcome.told.waitFor(seconds(30)); }

  TestPlatform test_;
  WorkerPool pool_{workers()};
  const std::shared_ptr<FakePostStore::Disk> disk_ = std::make_shared<FakePostStore::Disk>();
  StuckPostStore store_{disk_};
  const std::shared_ptr<Outbox> outbox_ =
      Outbox::create({test_.clock, test_.timers, test_.random, pool_, test_.consent, test_.counters,
                      test_.log, test_.books, test_.departures, test_.urlSessions, store_},
                     OutboxSettings{.enabled = true});
};

TEST_F(OutboxOnASlowDisk, KeepsNobodyWaitingForLongerThanALimit) {
  outbox_->begin();
  store_.isStuck = true;
  const auto first = keep(1000);
  ASSERT_TRUE(store_.began.waitFor(seconds(30)));
  const auto second = keep(1001);
  test_.timers.advance(Limits::outboxCommitTime - std::chrono::milliseconds(1));
  EXPECT_FALSE(first->told.waitFor(Duration(0)));
  test_.timers.advance(std::chrono::milliseconds(1));
  ASSERT_TRUE(isTold(*first));
  ASSERT_TRUE(isTold(*second));
  EXPECT_FALSE(first->isKept || second->isKept);
  EXPECT_FALSE(outbox_->isTaking());
  const auto third = keep(1000);
  ASSERT_TRUE(third->told.waitFor(Duration(0))) << "before keep() returns";
  EXPECT_FALSE(third->isKept);
  EXPECT_EQ(test_.counters.value(Reason::postNotKept), 3U);
  store_.isStuck = false;
  store_.goesOn.signal();
  EXPECT_TRUE(outbox_->list().empty()) << "what the disk has taken after all";
  EXPECT_FALSE(outbox_->isTaking()) << "it is left alone for a while";
  test_.timers.advance(Outbox::kDiskPause);
  const auto fourth = keep(1000);
  ASSERT_TRUE(isTold(*fourth));
  EXPECT_TRUE(fourth->isKept);
  EXPECT_TRUE(outbox_->finishWithin(seconds(30)));
  EXPECT_TRUE(pool_.shutDownWithin(seconds(30)));
  EXPECT_EQ(disk_->posts.size(), 1U);
}

}  // namespace
}  // namespace kyt
