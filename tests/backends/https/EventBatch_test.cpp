// The batch by itself, without a back end or a queue.
#include "backends/https/EventBatch.h"

#include <gtest/gtest.h>

#include "platform/objects/ObjectSize.h"
#include "tests/support/TestPlatform.h"

namespace kyt {
namespace {

class EventBatchTest : public testing::Test {
 protected:
  void append(int32_t method, uint64_t bytes = 10) {
    batch_.append({{"_method", method}, {"_sessionID", "old"}}, method, batch_.count(method) + 1, bytes,
                  sessionID_);
  }
  uint64_t estimate() { return batch_.sizeEstimate(sessionID_, platform_.memory); }

  TestPlatform platform_;
  std::optional<SessionIDPath> sessionID_;
  EventBatch batch_;
};

TEST_F(EventBatchTest, ExistsFromItsBeginningToItsTaking) {
  EXPECT_FALSE(batch_.exists());
  batch_.begin();
  EXPECT_TRUE(batch_.exists());
  EXPECT_EQ(batch_.size(), 0u);
  append(5);
  batch_.begin();  // goes on with the one that there is
  EXPECT_EQ(batch_.size(), 1u);
  static_cast<void>(batch_.take(sessionID_));
  EXPECT_FALSE(batch_.exists());
  append(5);
  EXPECT_TRUE(batch_.exists());
}

TEST_F(EventBatchTest, EndsWhenItIsEmptyAndOnlyThen) {
  batch_.begin();
  batch_.endIfEmpty();
  EXPECT_FALSE(batch_.exists());
  append(5);
  batch_.endIfEmpty();
  EXPECT_EQ(batch_.size(), 1u);
}

TEST_F(EventBatchTest, CountsTheRecordsOfEachMethodAndTheirBytes) {
  EXPECT_EQ(batch_.count(5), 0);
  for (const int32_t method : {5, 3, 5, 9, 5}) append(method);
  EXPECT_EQ(batch_.count(3), 1);
  EXPECT_EQ(batch_.count(5), 3);
  EXPECT_EQ(batch_.count(9), 1);
  EXPECT_EQ(batch_.count(4), 0);
  EXPECT_EQ(batch_.bytes(), 50u);
  batch_.append({}, 5, 1, 7, sessionID_);  // the count is the caller's, who may begin anew
  EXPECT_EQ(batch_.count(5), 1);
  EXPECT_EQ(batch_.bytes(), 57u);
}

TEST_F(EventBatchTest, GivesAllAndBeginsAnew) {
  append(5);
  append(6);
  const EventBatch::Taken taken = batch_.take(sessionID_);
  ASSERT_EQ(taken.records.size(), 2u);
  EXPECT_EQ(*taken.records[0].dictionary()->find("_method"), Value(5));
  EXPECT_EQ(*taken.records[1].dictionary()->find("_method"), Value(6));
  EXPECT_EQ(taken.bytes, 20u);
  EXPECT_EQ(batch_.bytes(), 0u);
  EXPECT_EQ(batch_.count(5), 0);
  EXPECT_EQ(batch_.size(), 0u);
  EXPECT_EQ(estimate(), 0u);
}

TEST_F(EventBatchTest, GivesNothingWhereThereIsNone) {
  const EventBatch::Taken taken = batch_.take(sessionID_);
  EXPECT_TRUE(taken.records.empty());
  EXPECT_EQ(taken.bytes, 0u);
}

TEST_F(EventBatchTest, ANewSessionIDIsWrittenIntoTheRecordsThatWereThereBefore) {
  append(5);
  sessionID_ = String("12.77");
  batch_.sessionIDChanged();
  append(6);
  const EventBatch::Taken taken = batch_.take(sessionID_);
  EXPECT_EQ(*taken.records[0].dictionary()->find("_sessionID"), Value("12.77"));
  EXPECT_EQ(*taken.records[1].dictionary()->find("_sessionID"), Value("old")) << "it came with its own";
}

TEST_F(EventBatchTest, AChangeBeforeTheBatchIsNotForIt) {
  sessionID_ = String("12.77");
  batch_.sessionIDChanged();
  append(5);
  append(5);
  for (const Value& record : batch_.take(sessionID_).records)
    EXPECT_EQ(*record.dictionary()->find("_sessionID"), Value("old"));
}

TEST_F(EventBatchTest, IsSizedByTheHealthReportsEstimate) {
  EXPECT_EQ(estimate(), 0u);
  append(5);
  append(6);
  append(5);
  uint64_t expected = 0;
  EventBatch copy = batch_;
  for (const Value& record : copy.take(sessionID_).records)
    expected += objectSizeEstimate(record, platform_.memory);
  EXPECT_EQ(estimate(), expected);
  EXPECT_EQ(estimate(), expected) << "asked again";
}

TEST_F(EventBatchTest, IsSizedAnewAfterANewSessionID) {
  append(5);
  const uint64_t before = estimate();
  sessionID_ = String(std::string(500, 'x'));
  batch_.sessionIDChanged();
  EXPECT_GE(estimate(), before + 500);
}

}  // namespace
}  // namespace kyt
