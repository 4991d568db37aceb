#include "platform/base/UserBudget.h"

#include <algorithm>

#include "platform/base/Limits.h"

namespace kyt {
namespace {

// Of the memory that the daemon may use. Two users at their limits, files that they upload included, leave as much as
// the daemon itself needs, and what the allocator loses between blocks.
constexpr uint64_t kPartOfMemory = 8;
constexpr uint64_t kMostBytes = 1u << 30;
constexpr uint64_t kPartOfDescriptors = 4;

// Whoever allows larger files means them to be sent.
uint64_t usualUploadingBytes(const Limits& limits, uint64_t partOfMemory) {
  const uint64_t usual = std::min(partOfMemory, Limits::maxUploadingBytes);
  const uint64_t ofOne = limits.maxUploadBytes;
  return ofOne == Limits().maxUploadBytes ? usual : std::max(usual, ofOne);
}

}  // namespace

UserShares UserShares::of(const Limits& limits, uint64_t memory, uint64_t descriptors) {
  const uint64_t partOfMemory = std::min(memory / kPartOfMemory, kMostBytes);
  UserShares shares;
  shares[Share::connections] = limits.maxConnectionsPerUser;
  shares[Share::descriptors] = limits.maxDescriptorsPerUser.value_or(descriptors / kPartOfDescriptors);
  shares[Share::bytes] = limits.maxBytesPerUser.value_or(partOfMemory);
  shares[Share::uploadedBytes] =
      limits.maxUploadingBytesPerUser.value_or(usualUploadingBytes(limits, partOfMemory));
  shares[Share::hierarchyTokens] = limits.maxHierarchyTokensPerUser;
  shares[Share::sharedDataBytes] = limits.maxSharedDataBytesPerUser;
  shares[Share::requestBytes] = Limits::maxOutstandingBytes;
  shares[Share::waitingBytes] = Limits::maxWaitingBytes;
  shares[Share::messageLogBytes] = Limits::maxMessageLogBytesPerUser;
  shares[Share::identifiers] = limits.maxCustomIdentifiersPerUser;
  shares[Share::logLines] = Limits::maxLogLinesPerSecond;
  shares[Share::workers] = Limits::maxWorkersPerUser;
  shares[Share::outboxBytes] = Limits::maxBytesOfAUserOnTheWayToTheOutbox;
  return shares;
}

bool UserAccount::take(Share share, uint64_t amount, unsigned leaving) {
  std::atomic<uint64_t>& taken = held(share);
  const uint64_t most = shares_[share] - (leaving != 0 ? shares_[share] / leaving : 0);
  uint64_t before = taken.load(std::memory_order_relaxed);
  do {
    if (before > most || amount > most - before) return false;
  } while (!taken.compare_exchange_weak(before, before + amount, std::memory_order_relaxed));
  return true;
}

bool UserAccount::holdsNothing() const {
  return std::all_of(held_.begin(), held_.end(),
                     [](const auto& held) { return held.load(std::memory_order_relaxed) == 0; });
}

std::shared_ptr<UserAccount> UserBudget::account(uint32_t user) {
  const MutexLock lock(mutex_);
  std::shared_ptr<UserAccount>& account = accounts_[user];
  if (account) return account;
  account = std::make_shared<UserAccount>(user, shares_);
  std::shared_ptr<UserAccount> made = account;
  if (accounts_.size() >= sweepAt_) {
    std::erase_if(accounts_, [](const auto& each) {
      return each.second.use_count() == 1 && each.second->holdsNothing();
    });
    sweepAt_ = std::max<size_t>(64, 2 * accounts_.size());
  }
  return made;
}

size_t UserBudget::accountCount() const {
  const MutexLock lock(mutex_);
  return accounts_.size();
}

Charge& Charge::operator=(Charge&& other) noexcept {
  if (this == &other) return *this;
  clear();
  account_ = std::move(other.account_);
  share_ = other.share_;
  amount_ = std::exchange(other.amount_, 0);
  return *this;
}

bool Charge::set(uint64_t amount, unsigned leaving) {
  if (account_ && amount > amount_ && !account_->take(share_, amount - amount_, leaving)) return false;
  if (account_ && amount < amount_) account_->giveBack(share_, amount_ - amount);
  amount_ = amount;
  return true;
}

void Charge::setAnyway(uint64_t amount) {
  if (account_ && amount > amount_) account_->takeAnyway(share_, amount - amount_);
  if (account_ && amount < amount_) account_->giveBack(share_, amount_ - amount);
  amount_ = amount;
}

Charge Charge::takeOut() {
  Charge all(account_, share_);
  all.amount_ = std::exchange(amount_, 0);
  return all;
}

}  // namespace kyt
