#include "receiver/Delivery.h"

#include <gtest/gtest.h>

#include <memory>
#include <optional>
#include <vector>

#include "platform/fake/FakePostStore.h"
#include "platform/fake/ManualClock.h"
#include "platform/fake/MemoryLogSink.h"
#include "receiver/Limits.h"
#include "tests/receiver/FakeLog.h"

namespace kyt::receiver {
namespace {

using Mood = FakeLog::Mood;

std::shared_ptr<const LogMessage> message(const std::string& id, size_t size = 10) {
  return std::make_shared<LogMessage>(LogMessage{id, {{"Kyt-Id", id}}, std::string(size, 'x')});
}

// Delivery and spool without their threads: turns are taken by hand.
class DeliveryTest : public ::testing::Test {
 protected:
  explicit DeliveryTest(uint64_t maxBytes = 10000) : spool_(store_, maxBytes, clock_, figures_, lines_) {
    EXPECT_FALSE(spool_.open());
    log_.start(delivery_);
    delivery_.logIsUp(true);
  }
  ~DeliveryTest() override { turn(); }

  std::shared_ptr<std::optional<Fate>> take(const std::string& id, size_t size = 10) {
    auto fate = std::make_shared<std::optional<Fate>>();
    delivery_.take(message(id, size), [fate](Fate is) {
      EXPECT_FALSE(*fate) << "answered twice";
      *fate = is;
    });
    return fate;
  }
  void turn() { spool_.turn(delivery_); }
  void pass(Duration time) {
    clock_.advance(time);
    delivery_.tick();
    spool_.tick();
    turn();
  }

  ManualClock clock_;
  Figures figures_;
  MemoryLogSink sink_;
  Log lines_{sink_};
  FakeLog log_;
  std::shared_ptr<FakePostStore::Disk> disk_ = std::make_shared<FakePostStore::Disk>();
  FakePostStore store_{disk_};
  Spool spool_;
  Delivery delivery_{log_, spool_, clock_, figures_, lines_, std::chrono::seconds(2)};
};

TEST_F(DeliveryTest, APostThatTheLogHasIsStored) {
  EXPECT_EQ(*take("a"), Fate::stored);
  EXPECT_EQ(spool_.posts(), 0U);
  EXPECT_TRUE(disk_->posts.empty());
}

TEST_F(DeliveryTest, ARepeatIsStoredAndCountedAsDuplicate) {
  EXPECT_EQ(*take("a"), Fate::stored);
  EXPECT_EQ(*take("a"), Fate::stored);
  EXPECT_EQ(figures_.duplicates, 1U);
}

TEST_F(DeliveryTest, APostThatIsNotAcknowledgedInTimeIsSpooledAndThenAnswered) {
  log_.setMood(Mood::isSilent);
  const auto fate = take("a");
  pass(std::chrono::milliseconds(1999));
  EXPECT_FALSE(*fate);
  clock_.advance(std::chrono::milliseconds(1));
  delivery_.tick();
  EXPECT_FALSE(*fate) << "before it is on disk";
  turn();
  EXPECT_EQ(*fate, Fate::spooled);
  EXPECT_EQ(disk_->posts.size(), 1U);
  EXPECT_EQ(figures_.logTimeouts, 1U);
}

TEST_F(DeliveryTest, WhatIsSpooledGoesToTheLogUnderItsOwnIDAndInOrder) {
  log_.setMood(Mood::refuses);
  const auto first = take("a"), second = take("b");
  turn();
  EXPECT_EQ(*first, Fate::spooled);
  EXPECT_EQ(*second, Fate::spooled);
  log_.setMood(Mood::stores);
  pass(std::chrono::seconds(1));
  pass(std::chrono::seconds(1));
  pass(std::chrono::seconds(1));
  EXPECT_EQ(log_.stored(), (std::map<std::string, int>{{"a", 1}, {"b", 1}}));
  const auto published = log_.published();
  EXPECT_EQ(published[published.size() - 2].second, "a");
  EXPECT_EQ(published[published.size() - 1].second, "b");
  EXPECT_TRUE(disk_->posts.empty());
  EXPECT_EQ(spool_.bytes(), 0U);
  EXPECT_EQ(figures_.replayed, 2U);
}

TEST_F(DeliveryTest, ALogThatFailedIsLeftAloneUntilItHasTakenSomethingOfTheSpool) {
  log_.setMood(Mood::isSilent);
  static_cast<void>(take("a"));
  pass(std::chrono::seconds(2));
  const size_t tries = log_.published().size();
  const auto fate = take("b");
  EXPECT_EQ(log_.published().size(), tries);
  turn();
  EXPECT_EQ(*fate, Fate::spooled) << "at once, without two seconds of waiting";
  log_.setMood(Mood::stores);
  pass(std::chrono::seconds(3));  // the try that was silent is late
  pass(std::chrono::seconds(1));
  pass(std::chrono::seconds(1));
  EXPECT_EQ(*take("c"), Fate::stored);
}

TEST_F(DeliveryTest, WhenTheLogGoesAwayWhatWasOnItsWayIsSpooledAtOnce) {
  log_.setMood(Mood::isSilent);
  const auto fate = take("a");
  delivery_.logIsUp(false);
  turn();
  EXPECT_EQ(*fate, Fate::spooled);
}

TEST_F(DeliveryTest, ALateAcknowledgementIsNoSecondAnswer) {
  log_.setMood(Mood::isSilent);
  const auto fate = take("a");
  const uint64_t token = log_.published().back().first;
  pass(std::chrono::seconds(2));
  EXPECT_EQ(*fate, Fate::spooled);
  delivery_.logAnswered(token, {LogVerdict::stored, {}});
  EXPECT_EQ(*fate, Fate::spooled);
}

TEST_F(DeliveryTest, WhatTheLogNeverTakesIsRefusedAndNotSpooled) {
  log_.setMood(Mood::refusesForGood);
  EXPECT_EQ(*take("a"), Fate::tooLargeForLog);
  turn();
  EXPECT_TRUE(disk_->posts.empty());
}

TEST_F(DeliveryTest, APostOfTheSpoolThatTheLogNeverTakesStaysAndStopsNoOther) {
  log_.setMood(Mood::refuses);
  static_cast<void>(take("a"));
  turn();
  log_.setMood(Mood::refusesForGood);
  pass(std::chrono::seconds(1));
  pass(std::chrono::seconds(1));
  turn();
  EXPECT_EQ(figures_.stuck, 1U);
  log_.setMood(Mood::stores);
  EXPECT_EQ(*take("b"), Fate::stored);
  EXPECT_EQ(disk_->posts.size(), 1U);
}

TEST_F(DeliveryTest, AFullSpoolRefuses) {
  log_.setMood(Mood::refuses);
  const auto first = take("a", 9000), second = take("b", 9000);
  turn();
  EXPECT_EQ(*first, Fate::spooled);
  EXPECT_EQ(*second, Fate::spoolFull);
}

TEST_F(DeliveryTest, ABrokenDiskRefusesAndTheLogIsTriedAgainWithoutASpool) {
  log_.setMood(Mood::refuses);
  disk_->problem = PostStoreProblem{PostStoreProblem::Kind::unavailable, "no space"};
  const auto fate = take("a");
  turn();
  EXPECT_EQ(*fate, Fate::spoolBroken);
  EXPECT_EQ(spool_.bytes(), 0U);
  EXPECT_TRUE(sink_.contains("no space"));
  log_.setMood(Mood::stores);
  pass(Limits::retryPause);
  EXPECT_EQ(*take("b"), Fate::stored);
}

TEST_F(DeliveryTest, WhoWaitsTooLongForTheDiskIsRefused) {
  log_.setMood(Mood::refuses);
  const auto fate = take("a");
  clock_.advance(Limits::spoolTime);
  spool_.tick();
  EXPECT_EQ(*fate, Fate::spoolBroken);
  turn();  // it was kept all the same, which is told to nobody
  EXPECT_EQ(disk_->posts.size(), 1U);
}

TEST_F(DeliveryTest, WhatAnEarlierProcessLeftIsReplayed) {
  log_.setMood(Mood::refuses);
  static_cast<void>(take("a"));
  static_cast<void>(take("b"));
  turn();
  Figures figures;
  FakePostStore store(disk_);
  Spool spool(store, 10000, clock_, figures, lines_);
  EXPECT_FALSE(spool.open());
  EXPECT_EQ(spool.posts(), 2U);
  FakeLog log;
  Delivery delivery(log, spool, clock_, figures, lines_, std::chrono::seconds(2));
  log.start(delivery);
  delivery.logIsUp(true);
  for (int i = 0; i < 3; ++i) spool.turn(delivery);
  EXPECT_EQ(log.stored(), (std::map<std::string, int>{{"a", 1}, {"b", 1}}));
  EXPECT_EQ(spool.posts(), 0U);
}

TEST_F(DeliveryTest, ADamagedSpoolIsSetAsideAndBegunAnew) {
  log_.setMood(Mood::refuses);
  static_cast<void>(take("a"));
  turn();
  disk_->problem = PostStoreProblem{PostStoreProblem::Kind::damaged, "malformed"};
  const auto broken = take("b");
  turn();
  EXPECT_EQ(*broken, Fate::spoolBroken);
  EXPECT_EQ(disk_->setAside, 1U);
  const auto kept = take("c");
  turn();
  EXPECT_EQ(*kept, Fate::spooled);
  EXPECT_EQ(spool_.posts(), 1U);
}

TEST(Partitions, AreChosenByTheIDAlone) {
  EXPECT_EQ(partitionOf("ffffffff00", 1), 0U);
  EXPECT_EQ(partitionOf("0000000a00", 4), 2U);
  EXPECT_EQ(partitionOf("ffffffff00", 10), 4294967295U % 10);
}

}  // namespace
}  // namespace kyt::receiver
