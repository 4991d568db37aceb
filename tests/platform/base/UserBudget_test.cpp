#include "platform/base/UserBudget.h"

#include <gtest/gtest.h>

#include <thread>
#include <vector>

#include "platform/base/Limits.h"

namespace kyt {
namespace {

constexpr uint64_t kMiB = 1u << 20;

UserShares sharesOf(uint64_t bytes) {
  Limits limits;
  limits.maxBytesPerUser = bytes;
  return UserShares::of(limits, 0, 0);
}

TEST(UserShares, OfASmallDeviceStayFarBelowWhatItsServiceMayHave) {
  constexpr uint64_t kService = 512 * kMiB / 4;  // MemoryMax=25%
  const UserShares shares = UserShares::of(Limits(), kService, 131072);
  EXPECT_EQ(shares[Share::bytes], 16 * kMiB);
  EXPECT_EQ(shares[Share::uploadedBytes], 16 * kMiB);
  EXPECT_EQ(shares[Share::descriptors], 32768u);
}

TEST(UserShares, OfALargeMachineAreBoundedAllTheSame) {
  const UserShares shares = UserShares::of(Limits(), uint64_t{1} << 40, 1048576);
  EXPECT_EQ(shares[Share::bytes], 1024 * kMiB);
  EXPECT_EQ(shares[Share::uploadedBytes], 256 * kMiB);
}

TEST(UserShares, AreWhatTheSettingsSay) {
  Limits limits;
  limits.maxConnectionsPerUser = 1;
  limits.maxBytesPerUser = 2;
  limits.maxDescriptorsPerUser = 3;
  limits.maxUploadingBytesPerUser = 4;
  limits.maxHierarchyTokensPerUser = 5;
  limits.maxSharedDataBytesPerUser = 6;
  const UserShares shares = UserShares::of(limits, 1024 * kMiB, 1024);
  EXPECT_EQ(shares[Share::connections], 1u);
  EXPECT_EQ(shares[Share::bytes], 2u);
  EXPECT_EQ(shares[Share::descriptors], 3u);
  EXPECT_EQ(shares[Share::uploadedBytes], 4u);
  EXPECT_EQ(shares[Share::hierarchyTokens], 5u);
  EXPECT_EQ(shares[Share::sharedDataBytes], 6u);
}

TEST(UserShares, HaveRoomForAFileAsLargeAsTheSettingsAllow) {
  Limits limits;
  limits.maxUploadBytes = 1024 * kMiB;
  EXPECT_EQ(UserShares::of(limits, 128 * kMiB, 1024)[Share::uploadedBytes], 1024 * kMiB);
}

TEST(UserAccount, RefusesWhatIsTooMuchAndTakesItOnceThereIsRoom) {
  UserBudget budget(sharesOf(100));
  const auto account = budget.account(1000);
  EXPECT_TRUE(account->take(Share::bytes, 60));
  EXPECT_FALSE(account->take(Share::bytes, 41));
  EXPECT_TRUE(account->take(Share::bytes, 40));
  EXPECT_FALSE(account->take(Share::bytes, ~uint64_t{0})) << "no sum is too large to be seen";
  account->giveBack(Share::bytes, 60);
  EXPECT_TRUE(account->take(Share::bytes, 41));
  EXPECT_EQ(account->holds(Share::bytes), 81u);
}

TEST(UserAccount, OfOneUserLeavesAnothersAlone) {
  UserBudget budget(sharesOf(100));
  EXPECT_TRUE(budget.account(1)->take(Share::bytes, 100));
  EXPECT_FALSE(budget.account(1)->take(Share::bytes, 1));
  EXPECT_TRUE(budget.account(2)->take(Share::bytes, 100));
}

TEST(UserAccount, TakenAnywayIsOverItsShareUntilItIsGivenBack) {
  UserBudget budget(sharesOf(100));
  const auto account = budget.account(1);
  account->takeAnyway(Share::bytes, 150);
  EXPECT_TRUE(account->isOver(Share::bytes));
  EXPECT_FALSE(account->take(Share::bytes, 0));
  account->giveBack(Share::bytes, 50);
  EXPECT_FALSE(account->isOver(Share::bytes));
}

TEST(UserAccount, LeavesAPartToWhatNeedsItMore) {
  UserBudget budget(sharesOf(100));
  const auto account = budget.account(1);
  EXPECT_FALSE(account->take(Share::bytes, 76, 4));
  EXPECT_TRUE(account->take(Share::bytes, 75, 4));
  EXPECT_TRUE(account->take(Share::bytes, 25));
}

TEST(UserBudget, KeepsAnAccountAsLongAsItHoldsSomething) {
  UserBudget budget(sharesOf(100));
  EXPECT_TRUE(budget.account(1)->take(Share::hierarchyTokens, 1));
  const auto held = budget.account(2);
  for (uint32_t user = 100; user < 10000; ++user) static_cast<void>(budget.account(user));
  EXPECT_LT(budget.accountCount(), 200u);
  EXPECT_EQ(budget.account(1)->holds(Share::hierarchyTokens), 1u);
  EXPECT_EQ(budget.account(2), held);
}

TEST(UserBudget, CountsExactlyWhenManyThreadsTake) {
  UserBudget budget(sharesOf(1000));
  std::atomic<uint64_t> taken{0};
  {
    std::vector<std::jthread> threads;
    for (int t = 0; t < 4; ++t)
      threads.emplace_back([&] {
        const auto account = budget.account(7);
        for (int i = 0; i < 1000; ++i) taken += account->take(Share::bytes, 1) ? 1 : 0;
      });
  }
  EXPECT_EQ(taken, 1000u);
  EXPECT_EQ(budget.account(7)->holds(Share::bytes), 1000u);
}

TEST(Charge, GivesBackWhatItHasAtItsEnd) {
  UserBudget budget(sharesOf(100));
  const auto account = budget.account(1);
  {
    Charge charge(account, Share::bytes);
    EXPECT_TRUE(charge.set(70));
    EXPECT_FALSE(charge.set(101));
    EXPECT_EQ(charge.amount(), 70u);
    EXPECT_TRUE(charge.set(100));
    EXPECT_TRUE(charge.set(10));
    EXPECT_EQ(account->holds(Share::bytes), 10u);
    charge.setAnyway(500);
    Charge moved = std::move(charge);
    EXPECT_EQ(account->holds(Share::bytes), 500u);
    Charge other(account, Share::bytes);
    EXPECT_FALSE(other.set(1));
    other = std::move(moved);
    EXPECT_EQ(account->holds(Share::bytes), 500u);
  }
  EXPECT_EQ(account->holds(Share::bytes), 0u);
}

TEST(Charge, OfNobodyIsNeverRefused) {
  Charge charge(nullptr, Share::bytes);
  EXPECT_TRUE(charge.set(~uint64_t{0}));
}

}  // namespace
}  // namespace kyt
