#include "platform/ipc/KeptBytes.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <string_view>

#include "platform/base/Limits.h"

namespace kyt {
namespace {

std::span<const std::byte> bytes(std::string_view text) {
  return std::as_bytes(std::span(text));
}

class KeptBytesTest : public ::testing::Test {
 protected:
  std::string kept() const {
    return {reinterpret_cast<const char*>(kept_.bytes().data()), kept_.bytes().size()};
  }
  const UserShares shares_ = [] {
    UserShares shares;
    shares[Share::bytes] = 100000;
    return shares;
  }();
  const std::shared_ptr<UserAccount> account_ = std::make_shared<UserAccount>(1000, shares_);
  KeptBytes kept_{account_};
};

TEST_F(KeptBytesTest, MayHoldAMessageOnceThereAreAsManyAsItNeeds) {
  EXPECT_FALSE(kept_.mayHoldMessage());
  ASSERT_TRUE(kept_.keep(bytes("abc")));
  EXPECT_TRUE(kept_.mayHoldMessage()) << "nobody looked yet";
  kept_.need(5);
  EXPECT_TRUE(kept_.needsMore());
  EXPECT_FALSE(kept_.mayHoldMessage());
  ASSERT_TRUE(kept_.append(bytes("de")));
  EXPECT_TRUE(kept_.mayHoldMessage());
  EXPECT_EQ(kept(), "abcde");
}

TEST_F(KeptBytesTest, KeepsAPartOfItself) {
  ASSERT_TRUE(kept_.keep(bytes("0123456789012345678901234567890123456789")));
  ASSERT_TRUE(kept_.keep(kept_.bytes().subspan(35)));
  EXPECT_EQ(kept(), "56789");
  ASSERT_TRUE(kept_.keep({}));
  EXPECT_TRUE(kept_.empty());
  EXPECT_FALSE(kept_.needsMore());
}

TEST_F(KeptBytesTest, CopiesWhatLeavesHalfOfTheBuffer) {
  std::array<std::byte, 8> buffer{};
  EXPECT_EQ(kept_.copyTo(buffer), 0u);
  ASSERT_TRUE(kept_.keep(bytes("abcd")));
  EXPECT_EQ(kept_.copyTo(buffer), 4u);
  EXPECT_TRUE(std::ranges::equal(std::span(buffer).first(4), bytes("abcd")));
  ASSERT_TRUE(kept_.keep(bytes("abcde")));
  EXPECT_EQ(kept_.copyTo(buffer), 0u);
}

TEST_F(KeptBytesTest, CountsLargeOnesWithTheUserUntilTheyAreGone) {
  ASSERT_TRUE(kept_.keep(bytes(std::string(Limits::freeBytes, 'x'))));
  EXPECT_EQ(account_->holds(Share::bytes), 0u) << "so many belong to the connection";
  ASSERT_TRUE(kept_.append(bytes("y")));
  EXPECT_EQ(account_->holds(Share::bytes), Limits::freeBytes + 1);
  ASSERT_TRUE(kept_.keep(bytes(std::string(50000, 'x'))));
  EXPECT_EQ(account_->holds(Share::bytes), 50000u);
  kept_.clear();
  EXPECT_EQ(account_->holds(Share::bytes), 0u);
}

TEST_F(KeptBytesTest, RefusesWhatTheUsersShareHasNoRoomFor) {
  EXPECT_FALSE(kept_.keep(bytes(std::string(100001, 'x'))));
  ASSERT_TRUE(kept_.keep(bytes(std::string(99999, 'x'))));
  EXPECT_FALSE(kept_.append(bytes("yz")));
}

}  // namespace
}  // namespace kyt
