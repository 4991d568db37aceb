#include "receiver/Delivery.h"

#include <gtest/gtest.h>

#include <memory>
#include <optional>
#include <vector>

#include "platform/fake/FakePostStore.h"
#include "platform/fake/ManualClock.h"
#include "platform/fake/MemoryLogSink.h"
#include "receiver/Limits.h"
#include "receiver/Metrics.h"
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
  explicit DeliveryTest(uint64_t maxBytes = 10000, uint32_t partitions = 1)
      : spool_(store_, maxBytes, clock_, figures_, lines_, partitions) {
    spool_.open();
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
  for (int i = 0; i < 4; ++i) pass(std::chrono::seconds(1));
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

// Where a balancer asks, no post comes to a receiver that is not ready: it would never learn that its disk is well again.
TEST_F(DeliveryTest, AFailureOfTheDiskKeepsPostsAwayForAWhileAlone) {
  MetricsSources sources{figures_, delivery_, spool_};
  MetricsHandler handler(sources);
  handler.open();
  EXPECT_EQ(handler.unreadiness(), nullptr);
  delivery_.logIsUp(false);
  disk_->problem = {PostStoreProblem::Kind::unavailable, "disk full"};
  const auto refused = take("a");
  turn();
  EXPECT_EQ(*refused, Fate::spoolBroken);
  ASSERT_NE(handler.unreadiness(), nullptr);
  EXPECT_STREQ(handler.unreadiness(), "neither log nor spool takes posts");
  pass(Limits::brokenTime - std::chrono::milliseconds(1));
  EXPECT_NE(handler.unreadiness(), nullptr);
  pass(std::chrono::milliseconds(1));
  EXPECT_EQ(handler.unreadiness(), nullptr) << "the next may try";
  const auto again = take("b");
  turn();
  EXPECT_EQ(*again, Fate::spoolBroken);
  EXPECT_NE(handler.unreadiness(), nullptr);
  pass(Limits::brokenTime);
  disk_->problem.reset();
  const auto kept = take("c");
  turn();
  EXPECT_EQ(*kept, Fate::spooled);
  pass(std::chrono::milliseconds(1));
  EXPECT_EQ(handler.unreadiness(), nullptr);
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
  spool.open();
  EXPECT_EQ(spool.posts(), 2U);
  FakeLog log;
  Delivery delivery(log, spool, clock_, figures, lines_, std::chrono::seconds(2));
  log.start(delivery);
  delivery.logIsUp(true);
  for (int i = 0; i < 3; ++i) spool.turn(delivery);
  EXPECT_EQ(log.stored(), (std::map<std::string, int>{{"a", 1}, {"b", 1}}));
  EXPECT_EQ(spool.posts(), 0U);
}

TEST_F(DeliveryTest, ASpoolThatTheDiskDoesNotGiveIsOpenedLaterAndNothingIsWrittenBefore) {
  log_.setMood(Mood::refuses);
  static_cast<void>(take("a"));
  turn();
  Figures figures;
  FakePostStore store(disk_);
  disk_->problem = PostStoreProblem{PostStoreProblem::Kind::unavailable, "read-only"};
  Spool spool(store, 10000, clock_, figures, lines_);
  spool.open();
  EXPECT_TRUE(spool.isBroken());
  EXPECT_TRUE(sink_.contains("read-only"));
  std::optional<SpoolVerdict> verdict;
  const auto add = [&] {
    verdict.reset();
    spool.add(message("b"), [&](SpoolVerdict is) { verdict = is; });
    spool.turn(delivery_);
  };
  disk_->problem.reset();
  add();
  EXPECT_EQ(verdict, SpoolVerdict::broken) << "it would take the number of one that is there";
  clock_.advance(Limits::reopenPause);
  add();
  EXPECT_EQ(verdict, SpoolVerdict::kept);
  EXPECT_FALSE(spool.isBroken());
  ASSERT_EQ(disk_->posts.size(), 2U);
  EXPECT_EQ(disk_->posts.begin()->second.url, "a");
  EXPECT_EQ(spool.posts(), 2U);
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
  EXPECT_EQ(spool_.damagedFiles(), 1U);
  EXPECT_EQ(figures_.spoolFailures, 1U);
  EXPECT_TRUE(sink_.contains("its 1 posts devices think delivered"));
  const auto kept = take("c");
  turn();
  EXPECT_EQ(*kept, Fate::spooled);
  EXPECT_EQ(spool_.posts(), 1U);
}

// Two partitions, of which one takes nothing: IDs that begin with an even digit are of partition 0.
class DeliveryToPartitions : public DeliveryTest {
 protected:
  DeliveryToPartitions() : DeliveryTest(100000, 2) {}
  static std::string idOf(uint32_t partition, int number) {
    return (number < 10    ? "000000"
            : number < 100 ? "00000"
                           : "0000") +
           std::to_string(number) + std::to_string(partition) + "ff";
  }
  void setMoodOf(uint32_t partition, Mood mood) {
    for (int i = 0; i < 200; ++i) log_.setMoodOf(idOf(partition, i), mood);
  }
  // Posts of both in the spool.
  void fillSpool() {
    log_.setMood(Mood::refuses);
    for (int i = 0; i < 100; ++i)
      for (const uint32_t partition : {0U, 1U}) static_cast<void>(take(idOf(partition, i)));
    turn();
    ASSERT_EQ(spool_.posts(), 200U);
    log_.setMood(Mood::stores);
  }
  [[nodiscard]] size_t storedOf(uint32_t partition) {
    size_t posts = 0;
    for (const auto& [id, times] : log_.stored()) posts += partitionOf(id, 2) == partition ? 1 : 0;
    return posts;
  }
  void refuse(uint32_t partition) { delivery_.partitionRefused(partition, "nobody takes it"); }
  void expectTheOthersAreStored() {
    for (int i = 0; i < 40 && spool_.posts() != 100; ++i) pass(std::chrono::seconds(1));
    EXPECT_EQ(storedOf(1), 100U);
    EXPECT_EQ(storedOf(0), 0U);
    EXPECT_EQ(*take(idOf(1, 150)), Fate::stored);
    const auto spooled = take(idOf(0, 150));
    turn();
    EXPECT_EQ(*spooled, Fate::spooled) << "at once: that partition takes nothing";
    EXPECT_EQ(delivery_.failing(), 1U);
  }
  void expectAllAreStoredOnceItTakesAgain() {
    setMoodOf(0, Mood::stores);
    for (int i = 0; i < 40 && spool_.posts() != 0; ++i) pass(std::chrono::seconds(1));
    EXPECT_EQ(storedOf(0), 101U);
    EXPECT_EQ(*take(idOf(0, 160)), Fate::stored);
    EXPECT_EQ(delivery_.failing(), 0U);
  }
};

TEST_F(DeliveryToPartitions, OneThatIsRefusedAsAWholeCostsTheOthersNothing) {
  log_.setMood(Mood::isSilent);
  const auto first = take(idOf(0, 1)), second = take(idOf(0, 2)), other = take(idOf(1, 1));
  refuse(0);
  turn();
  EXPECT_EQ(*first, Fate::spooled);
  EXPECT_EQ(*second, Fate::spooled);
  EXPECT_FALSE(other->has_value()) << "it is still on its way";
  EXPECT_EQ(delivery_.failing(), 1U);
  EXPECT_EQ(figures_.logRefusals, 2U);
  EXPECT_TRUE(sink_.contains("log: nobody takes it; posts of partition 0 go to the spool"));
  const auto later = take(idOf(0, 3));
  turn();
  EXPECT_EQ(*later, Fate::spooled) << "at once";
}

TEST_F(DeliveryToPartitions, ARefusalOfOneWithNothingOnItsWaySaysNothing) {
  log_.setMood(Mood::isSilent);
  const auto other = take(idOf(1, 1));
  refuse(0);
  EXPECT_EQ(delivery_.failing(), 0U);
  EXPECT_EQ(figures_.logRefusals, 0U);
  EXPECT_EQ(delivery_.pending(), 1U);
}

TEST_F(DeliveryToPartitions, OneThatRefusesKeepsNoPostOfAnotherFromTheLog) {
  fillSpool();
  setMoodOf(0, Mood::refuses);
  expectTheOthersAreStored();
  expectAllAreStoredOnceItTakesAgain();
}

TEST_F(DeliveryToPartitions, OneThatIsSilentKeepsNoPostOfAnotherFromTheLog) {
  fillSpool();
  setMoodOf(0, Mood::isSilent);
  expectTheOthersAreStored();
  for (int i = 0; i < 3; ++i) pass(std::chrono::seconds(1));
  expectAllAreStoredOnceItTakesAgain();
}

TEST_F(DeliveryToPartitions, OneThatRefusesIsTriedWithOnePostAtATime) {
  fillSpool();
  setMoodOf(0, Mood::refuses);
  expectTheOthersAreStored();
  const size_t before = log_.published().size();
  for (int i = 0; i < 10; ++i) pass(Limits::replayPause);
  EXPECT_LE(log_.published().size() - before, 10U);
  EXPECT_GE(log_.published().size() - before, 4U);
}

TEST_F(DeliveryTest, OnePostThatTheLogAlwaysRefusesStopsNoOther) {
  log_.setMood(Mood::refuses);
  for (const char* id : {"a", "b", "c", "d"}) static_cast<void>(take(id));
  turn();
  log_.setMood(Mood::stores);
  log_.setMoodOf("a", Mood::refuses);
  for (int i = 0; i < 20; ++i) pass(std::chrono::seconds(1));
  EXPECT_EQ(log_.stored(), (std::map<std::string, int>{{"b", 1}, {"c", 1}, {"d", 1}}));
  static_cast<void>(take("e"));
  for (int i = 0; i < 4; ++i) pass(std::chrono::seconds(1));
  EXPECT_EQ(log_.stored().count("e"), 1U);
}

TEST_F(DeliveryTest, ARowOfTheSpoolThatIsDamagedCostsThatPostAlone) {
  log_.setMood(Mood::refuses);
  for (const char* id : {"a", "b", "c"}) static_cast<void>(take(id));
  turn();
  log_.setMood(Mood::stores);
  disk_->unreadable = {1};
  disk_->unreadableIs = PostStoreProblem::Kind::damaged;
  for (int i = 0; i < 8; ++i) pass(std::chrono::seconds(1));
  EXPECT_EQ(log_.stored(), (std::map<std::string, int>{{"b", 1}, {"c", 1}}));
  EXPECT_EQ(figures_.stuck, 1U);
  EXPECT_EQ(figures_.spoolFailures, 1U);
  EXPECT_EQ(spool_.posts(), 1U);
  EXPECT_EQ(*take("d"), Fate::stored);
}

TEST_F(DeliveryTest, ARowThatTheDiskDoesNotGiveForNowIsTriedAgainAndStopsNoOther) {
  log_.setMood(Mood::refuses);
  for (const char* id : {"a", "b", "c"}) static_cast<void>(take(id));
  turn();
  log_.setMood(Mood::stores);
  disk_->unreadable = {1};
  for (int i = 0; i < 8; ++i) pass(std::chrono::seconds(1));
  EXPECT_EQ(log_.stored(), (std::map<std::string, int>{{"b", 1}, {"c", 1}}));
  EXPECT_GE(figures_.spoolFailures, 2U);
  EXPECT_EQ(sink_.count("I/O error"), 1U);
  EXPECT_EQ(*take("d"), Fate::stored) << "that row shows nothing of the log";
  disk_->unreadable.clear();
  for (int i = 0; i < 4; ++i) pass(std::chrono::seconds(1));
  EXPECT_EQ(log_.stored().count("a"), 1U);
  EXPECT_EQ(spool_.posts(), 0U);
}

TEST_F(DeliveryToPartitions, TheLogTakesMessagesWhileOneOfThoseThatAreUsedDoes) {
  EXPECT_TRUE(delivery_.takesMessages());
  setMoodOf(0, Mood::refuses);
  static_cast<void>(take(idOf(0, 1)));
  EXPECT_FALSE(delivery_.takesMessages()) << "no other has shown that it does";
  static_cast<void>(take(idOf(1, 1)));
  EXPECT_TRUE(delivery_.takesMessages());
  setMoodOf(1, Mood::isSilent);
  static_cast<void>(take(idOf(1, 2)));
  pass(std::chrono::seconds(2));
  EXPECT_FALSE(delivery_.takesMessages());
  setMoodOf(1, Mood::stores);
  for (int i = 0; i < 4; ++i) pass(std::chrono::seconds(1));
  EXPECT_TRUE(delivery_.takesMessages());
  delivery_.logIsUp(false);
  EXPECT_FALSE(delivery_.takesMessages());
}

TEST_F(DeliveryTest, WhatTheLogNeverTakesIsToldOnceAMinute) {
  log_.setMood(Mood::refusesForGood);
  for (int i = 0; i < 100; ++i) EXPECT_EQ(*take(std::to_string(i)), Fate::tooLargeForLog);
  EXPECT_EQ(sink_.count("refused for good: 1, the last for too large"), 1U);
  EXPECT_EQ(sink_.count("refused for good"), 1U);
  clock_.advance(Limits::tellPause);
  static_cast<void>(take("a"));
  EXPECT_EQ(sink_.count("refused for good: 100, the last for too large"), 1U);
  EXPECT_EQ(figures_.logRefusalsForGood, 101U);
}

TEST_F(DeliveryTest, APostThatTheLogNeverTakesDoesNotMakeTheSpoolOld) {
  log_.setMood(Mood::refuses);
  for (const char* id : {"a", "b"}) static_cast<void>(take(id));
  turn();
  clock_.advance(std::chrono::seconds(100));
  EXPECT_GE(spool_.oldestSeconds(), 100U);
  log_.setMoodOf("a", Mood::refusesForGood);
  for (int i = 0; i < 6; ++i) pass(std::chrono::seconds(1));
  EXPECT_GE(spool_.oldestSeconds(), 100U) << "b waits";
  log_.setMood(Mood::stores);
  for (int i = 0; i < 6; ++i) pass(std::chrono::seconds(1));
  EXPECT_EQ(spool_.oldestSeconds(), 0U);
  EXPECT_EQ(spool_.posts(), 1U);
  EXPECT_EQ(spool_.bytes(), PostStore::bytesOf(disk_->posts.begin()->second)) << "its room is taken";
  EXPECT_EQ(figures_.stuck, 1U);
}

TEST_F(DeliveryTest, APostThatTheLogNeverTookIsTriedAgainAtTheNextStart) {
  log_.setMood(Mood::refuses);
  static_cast<void>(take("a"));
  turn();
  log_.setMood(Mood::refusesForGood);
  for (int i = 0; i < 3; ++i) pass(std::chrono::seconds(1));
  ASSERT_EQ(figures_.stuck, 1U);
  Figures figures;
  FakePostStore store(disk_);
  Spool spool(store, 10000, clock_, figures, lines_);
  spool.open();
  FakeLog log;
  Delivery delivery(log, spool, clock_, figures, lines_, std::chrono::seconds(2));
  log.start(delivery);
  delivery.logIsUp(true);
  for (int i = 0; i < 3; ++i) spool.turn(delivery);
  EXPECT_EQ(log.stored().count("a"), 1U);
  EXPECT_EQ(spool.posts(), 0U);
}

TEST(Partitions, AreChosenByTheIDAlone) {
  EXPECT_EQ(partitionOf("ffffffff00", 1), 0U);
  EXPECT_EQ(partitionOf("0000000a00", 4), 2U);
  EXPECT_EQ(partitionOf("ffffffff00", 10), 4294967295U % 10);
}

}  // namespace
}  // namespace kyt::receiver
