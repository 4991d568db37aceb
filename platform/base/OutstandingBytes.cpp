#include "platform/base/OutstandingBytes.h"

#include "platform/base/Limits.h"
#include "platform/base/UserBudget.h"

namespace kyt {

OutstandingBytes::~OutstandingBytes() {
  for (User* user = first_.load(); user != nullptr;) delete std::exchange(user, user->next_);
}

OutstandingBytes::User& OutstandingBytes::user(const std::shared_ptr<UserAccount>& account) {
  User* first = first_.load(std::memory_order_acquire);
  std::unique_ptr<User> made;
  for (;;) {
    for (User* user = first; user != nullptr; user = user->next_)
      if (user->account_ == account) return *user;
    if (!made) made = std::make_unique<User>(account);
    made->next_ = first;
    if (first_.compare_exchange_weak(first, made.get(), std::memory_order_acq_rel)) return *made.release();
  }
}

size_t OutstandingBytes::User::most() const {
  return account_ ? account_->most(Share::requestBytes) : Limits::maxOutstandingBytes;
}

size_t OutstandingBytes::User::mostWaiting() const {
  return account_ ? account_->most(Share::waitingBytes) : Limits::maxWaitingBytes;
}

uint64_t OutstandingBytes::User::owner() const {
  return account_ ? uint64_t{account_->user()} + 1 : 0;
}

bool OutstandingBytes::User::take(size_t bytes) {
  size_t before = bytes_.load(std::memory_order_relaxed);
  do {
    if (before + bytes > most()) return false;
  } while (!bytes_.compare_exchange_weak(before, before + bytes, std::memory_order_relaxed));
  if (!account_ || account_->take(Share::bytes, bytes, 2 * kLeftForMessages)) return true;
  bytes_.fetch_sub(bytes, std::memory_order_relaxed);
  return false;
}

bool OutstandingBytes::User::takeReply(size_t bytes) {
  return !account_ || account_->take(Share::bytes, bytes, 2 * kLeftForMessages);
}

void OutstandingBytes::User::giveReplyBack(size_t bytes) {
  if (account_) account_->giveBack(Share::bytes, bytes);
}

void OutstandingBytes::User::giveBack(size_t bytes) {
  bytes_.fetch_sub(bytes, std::memory_order_relaxed);
  if (account_) account_->giveBack(Share::bytes, bytes);
}

}  // namespace kyt
