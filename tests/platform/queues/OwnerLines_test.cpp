#include "platform/queues/OwnerLines.h"

#include <gtest/gtest.h>

#include <string>

#include "platform/fake/ManualExecutor.h"
#include "platform/queues/SerialQueue.h"

namespace kyt {
namespace {

class OwnerLinesTest : public ::testing::Test {
 protected:
  OwnerLines<SerialQueue>::Item queue(const char* name, uint64_t owner) {
    return SerialQueue::create(name, executor_, owner);
  }
  std::string rest() {
    std::string names;
    while (const OwnerLines<SerialQueue>::Item next = lines_.pop()) names += next->label();
    return names;
  }
  ManualExecutor executor_;
  OwnerLines<SerialQueue> lines_;
};

TEST_F(OwnerLinesTest, LetOwnersTakeTurns) {
  for (const char* name : {"a", "b", "c", "d"}) lines_.push(queue(name, 1000));
  lines_.push(queue("X", 1001));
  lines_.push(queue("Y", 1001));
  lines_.push(queue("0", 0));
  EXPECT_EQ(lines_.size(), 7u);
  EXPECT_EQ(rest(), "aX0bYcd");
  EXPECT_TRUE(lines_.empty());
}

TEST_F(OwnerLinesTest, WhoComesAgainStandsBehindItsOwnersOthers) {
  lines_.push(queue("a", 1000));
  lines_.push(queue("b", 1000));
  const OwnerLines<SerialQueue>::Item first = lines_.pop();
  lines_.push(first);
  lines_.push(queue("X", 1001));
  EXPECT_EQ(rest(), "bXa");
}

TEST_F(OwnerLinesTest, APlaceBeforeAllOthersCanBeGiven) {
  lines_.push(queue("X", 1001));
  lines_.push(queue("a", 1000));
  lines_.pushFirst(queue("b", 1000));
  EXPECT_EQ(rest(), "bXa");
}

TEST_F(OwnerLinesTest, OfManyOwnersAreNotKeptForEver) {
  for (uint64_t owner = 0; owner < 1000; ++owner) lines_.push(queue("a", owner));
  EXPECT_EQ(lines_.takeAll().size(), 1000u);
  EXPECT_TRUE(lines_.empty());
  lines_.push(queue("b", 500));
  EXPECT_EQ(rest(), "b");
}

}  // namespace
}  // namespace kyt
