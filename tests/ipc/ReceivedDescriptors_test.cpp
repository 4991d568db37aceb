#include "platform/ipc/ReceivedDescriptors.h"

#include <gtest/gtest.h>

#include "platform/base/Limits.h"

namespace kyt {
namespace {

int closedSum = 0;

std::vector<Descriptor> numbered(int first, int count) {
  std::vector<Descriptor> made;
  for (int i = 0; i < count; ++i) made.emplace_back(first + i, [](int fd) { closedSum += fd; });
  return made;
}

class ReceivedDescriptorsTest : public ::testing::Test {
 protected:
  ReceivedDescriptorsTest() { closedSum = 0; }
  const UserShares shares_ = [] {
    UserShares shares;
    shares[Share::descriptors] = 40;
    return shares;
  }();
  const std::shared_ptr<UserAccount> account_ = std::make_shared<UserAccount>(1000, shares_);
  ReceivedDescriptors descriptors_{account_};
};

TEST_F(ReceivedDescriptorsTest, BelongToMessagesInTheirOrder) {
  ASSERT_TRUE(descriptors_.add(numbered(10, 3)));
  EXPECT_EQ(account_->holds(Share::descriptors), 3u);
  std::vector<Descriptor> taken;
  EXPECT_EQ(descriptors_.take(2, taken), nullptr);
  ASSERT_EQ(taken.size(), 2u);
  EXPECT_EQ(taken[0].get(), 10);
  EXPECT_EQ(taken[1].get(), 11);
  EXPECT_EQ(account_->holds(Share::descriptors), 1u);
  descriptors_.clear();
  EXPECT_EQ(closedSum, 12);
  EXPECT_EQ(account_->holds(Share::descriptors), 0u);
}

TEST_F(ReceivedDescriptorsTest, SayWhatIsWrongWithAMessageThatClaimsTooMany) {
  ASSERT_TRUE(descriptors_.add(numbered(10, 1)));
  std::vector<Descriptor> taken;
  EXPECT_STREQ(descriptors_.take(2, taken), "a message claims descriptors that did not come");
  EXPECT_STREQ(descriptors_.take(Limits::maxDescriptorsPerMessage + 1, taken),
               "a message claims more descriptors than it may carry");
  EXPECT_TRUE(taken.empty());
}

TEST_F(ReceivedDescriptorsTest, OfTheHandshakeStayOnlyWhereTheClientMayPassThem) {
  ASSERT_TRUE(descriptors_.add(numbered(10, 1)));
  descriptors_.agree(true);
  EXPECT_EQ(closedSum, 0);
  descriptors_.agree(false);
  EXPECT_EQ(closedSum, 10);
  ASSERT_TRUE(descriptors_.add(numbered(5, 1)));
  EXPECT_EQ(closedSum, 15) << "nor do those that come later";
}

TEST_F(ReceivedDescriptorsTest, AreTooManyForOneMessageBeyondItsLimit) {
  ASSERT_TRUE(descriptors_.add(numbered(10, Limits::maxDescriptorsPerMessage)));
  EXPECT_FALSE(descriptors_.tooManyForOneMessage());
  ASSERT_TRUE(descriptors_.add(numbered(1, 1)));
  EXPECT_TRUE(descriptors_.tooManyForOneMessage());
}

TEST_F(ReceivedDescriptorsTest, AreRefusedWhereTheUsersShareHasNoRoom) {
  EXPECT_FALSE(descriptors_.add(numbered(1, 41)));
}

}  // namespace
}  // namespace kyt
