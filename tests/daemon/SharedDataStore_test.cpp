#include "daemon/SharedDataStore.h"

#include <gtest/gtest.h>

#include <string>

#include "platform/base/Limits.h"

namespace kyt {
namespace {

constexpr uint32_t kOne = 1, kTwo = 2;

UserShares sharesWith(size_t maxSharedDataBytes) {
  Limits limits;
  limits.maxSharedDataBytesPerUser = maxSharedDataBytes;
  return UserShares::of(limits, uint64_t{1} << 30, 1024);
}

TEST(SharedDataStore, HoldsNothingForATokenThatNobodyUsed) {
  UserBudget budget(sharesWith(10000));
  SharedDataStore store(budget);
  EXPECT_FALSE(store.dictionary("T"));
  store.removeObject("T", "k");
  store.removeToken("T");
  EXPECT_EQ(store.bytesOfUser(kOne), 0U);
}

TEST(SharedDataStore, AnEmptyUpdateMakesAnEmptyDictionary) {
  UserBudget budget(sharesWith(10000));
  SharedDataStore store(budget);
  EXPECT_TRUE(store.update("T", Dictionary(), kOne));
  EXPECT_EQ(store.dictionary("T"), Dictionary());
}

TEST(SharedDataStore, ChargesAValueToWhoWroteItLast) {
  UserBudget budget(sharesWith(10000));
  SharedDataStore store(budget);
  EXPECT_TRUE(store.update("T", Dictionary{{"k", std::string(1000, 'x')}}, kOne));
  const uint64_t before = store.bytesOfUser(kOne);
  EXPECT_GE(before, 1000U);
  EXPECT_TRUE(store.update("T", Dictionary{{"k", std::string(500, 'y')}}, kTwo));
  EXPECT_LT(store.bytesOfUser(kOne), before - 900);
  EXPECT_GE(store.bytesOfUser(kTwo), 500U);
}

TEST(SharedDataStore, ChargesWhatContainersHold) {
  UserBudget budget(sharesWith(100000));
  SharedDataStore store(budget);
  EXPECT_TRUE(store.update(
      "T", Dictionary{{"k", Array{std::string(100, 'x'), Dictionary{{"n", Data(std::string(200, 'd'))}}}}},
      kOne));
  EXPECT_GE(store.bytesOfUser(kOne), 300U);
}

TEST(SharedDataStore, AUserMayReplaceAValueAtTheLimit) {
  UserBudget budget(sharesWith(1500));
  SharedDataStore store(budget);
  EXPECT_TRUE(store.update("T", Dictionary{{"k", std::string(900, 'x')}}, kOne));
  EXPECT_FALSE(store.update("T", Dictionary{{"l", std::string(900, 'x')}}, kOne));
  EXPECT_TRUE(store.update("T", Dictionary{{"k", std::string(901, 'z')}}, kOne));
  EXPECT_EQ(store.dictionary("T")->size(), 1U);
  EXPECT_TRUE(store.update("T", Dictionary{{"l", std::string(900, 'x')}}, kTwo)) << "another user's limit";
}

TEST(SharedDataStore, ARefusedUpdateMakesNoToken) {
  UserBudget budget(sharesWith(300));
  SharedDataStore store(budget);
  EXPECT_FALSE(store.update("T", Dictionary{{"k", std::string(1000, 'x')}}, kOne));
  EXPECT_FALSE(store.dictionary("T"));
  EXPECT_EQ(store.bytesOfUser(kOne), 0U);
}

TEST(SharedDataStore, ManyEmptyEntriesPassTheLimitToo) {
  UserBudget budget(sharesWith(10000));
  SharedDataStore store(budget);
  int accepted = 0;
  while (accepted < 1000 && store.update("T", Dictionary{{std::to_string(accepted), 0}}, kOne)) ++accepted;
  EXPECT_LT(accepted, 100);
}

TEST(SharedDataStore, TakesOfItsUsersMemory) {
  Limits limits;
  limits.maxSharedDataBytesPerUser = 1u << 20;
  limits.maxBytesPerUser = 10000;
  UserBudget budget(UserShares::of(limits, uint64_t{1} << 30, 1024));
  SharedDataStore store(budget);
  const auto account = budget.account(kOne);
  EXPECT_TRUE(store.update("T", Dictionary{{"k", std::string(5000, 'x')}}, kOne));
  const uint64_t held = account->holds(Share::bytes);
  EXPECT_GE(held, 5000U);
  EXPECT_FALSE(store.update("T", Dictionary{{"l", std::string(3000, 'x')}}, kOne));
  EXPECT_EQ(account->holds(Share::bytes), held);
  EXPECT_EQ(store.bytesOfUser(kOne), held) << "what was refused counts nowhere";
  EXPECT_TRUE(store.update("T", Dictionary{{"k", std::string(6000, 'y')}}, kOne))
      << "in the place of the former";
  EXPECT_EQ(account->holds(Share::bytes), held + 1000);
  store.removeToken("T");
  EXPECT_EQ(account->holds(Share::bytes), 0U);
}

TEST(SharedDataStore, WhatIsRemovedIsChargedNoMore) {
  UserBudget budget(sharesWith(10000));
  SharedDataStore store(budget);
  EXPECT_TRUE(store.update("T", Dictionary{{"k", 1}, {"l", std::string(800, 'x')}}, kOne));
  store.removeObject("T", "l");
  store.removeObject("T", "absent");
  EXPECT_EQ(store.dictionary("T"), (Dictionary{{"k", 1}}));
  EXPECT_LT(store.bytesOfUser(kOne), 800U);
  store.removeToken("T");
  EXPECT_EQ(store.bytesOfUser(kOne), 0U);
  EXPECT_FALSE(store.dictionary("T"));
}

}  // namespace
}  // namespace kyt
