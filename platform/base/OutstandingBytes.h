// What the requests of one URL session that have not completed count (countedBytes), each user's apart, towards
// Share::requestBytes and towards what the user may hold in all. Used by those who implement that port. Any thread.
#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <utility>

namespace kyt {

class UserAccount;

class OutstandingBytes {
 public:
  class User {
   public:
    explicit User(std::shared_ptr<UserAccount> account) : account_(std::move(account)) {}
    // Whether there was room; then it counts until it is given back.
    [[nodiscard]] bool take(size_t bytes);
    void giveBack(size_t bytes);
    // A reply's body, towards what the user may hold in all alone.
    [[nodiscard]] bool takeReply(size_t bytes);
    void giveReplyBack(size_t bytes);
    // The most that may wait for a network.
    [[nodiscard]] size_t mostWaiting() const;
    // Of the queue that runs its completions (SerialQueue): 0 for the daemon's own.
    [[nodiscard]] uint64_t owner() const;

   private:
    friend class OutstandingBytes;
    [[nodiscard]] size_t most() const;
    const std::shared_ptr<UserAccount> account_;
    std::atomic<size_t> bytes_{0};
    User* next_ = nullptr;
  };

  OutstandingBytes() = default;
  ~OutstandingBytes();
  OutstandingBytes(const OutstandingBytes&) = delete;
  OutstandingBytes& operator=(const OutstandingBytes&) = delete;
  // The same one each time; it lives as long as this. Mostly there is one: most sessions serve one client.
  [[nodiscard]] User& user(const std::shared_ptr<UserAccount>& account);

 private:
  std::atomic<User*> first_{nullptr};
};

}  // namespace kyt
