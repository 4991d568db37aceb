// What each user's clients may hold of the daemon at once, so that a client hurts none but its own user. One place for
// all such limits, each a row of `kShareRows` and a number in `UserShares`. An account counts some of them here; the others
// are counted where they are held, against the number here. docs/SECURITY.md has the same table. A user is the
// one that the kernel names as the connection's other end, whatever its clients say.
//
// Whoever keeps something on behalf of a client takes it from the user's account first, with a Charge where it can,
// and does without when the account refuses. What exists already and must be kept is taken anyway, and makes the
// account full for what comes next. The composition root owns the one UserBudget, which outlives its accounts. Any
// thread; taking costs one atomic operation. Without an account (null) nothing is counted and nothing is refused:
// the daemon's own requests, and tests.
#pragma once

#include <array>
#include <atomic>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <unordered_map>
#include <utility>

#include "platform/base/Adjustable.h"
#include "platform/base/Mutex.h"

namespace kyt {

struct Limits;

enum class Share : uint8_t {
  // Counted in the user's account.
  connections,  // ending ones included
  descriptors,  // of connections, and of messages that are not complete yet
  // Memory: connections, half messages, replies to the client and of servers, session information, batches, posts,
  // datagrams, hierarchies.
  bytes,
  uploadedBytes,    // of files, in memory until they are answered
  hierarchyTokens,  // they stay for the life of the process
  sharedDataBytes,  // so does this
  // Counted by their holder.
  requestBytes,     // URLSession: not answered yet, in each session
  waitingBytes,     // … of these, waiting for a network
  messageLogBytes,  // MessageLogFiles: in one file, since the daemon started
  identifiers,      // TomlUserDefaults: custom ones of its programs, kept on disk for good
  logLines,         // LineLimits: of each text a second
  workers,          // WorkerPool: that run its connections, or wait in them
  outboxBytes,      // Outbox: on their way to its disk
  numberOfShares
};

// What people call them; `setting` is a key of "[limits]", empty where there is none.
struct ShareRow {
  Share share;
  const char* name;
  const char* unit;
  const char* setting;
};
inline constexpr std::array<ShareRow, static_cast<size_t>(Share::numberOfShares)> kShareRows{{
    {Share::connections, "connections", "connections", "max_connections_per_user"},
    {Share::descriptors, "descriptors", "descriptors", "max_descriptors_per_user"},
    {Share::bytes, "bytes", "bytes", "max_bytes_per_user"},
    {Share::uploadedBytes, "bytes of files", "bytes", "max_uploading_bytes_per_user"},
    {Share::hierarchyTokens, "hierarchy tokens", "tokens", "max_hierarchy_tokens_per_user"},
    {Share::sharedDataBytes, "shared data", "bytes", "max_shared_data_bytes_per_user"},
    {Share::requestBytes, "requests", "bytes", ""},
    {Share::waitingBytes, "waiting requests", "bytes", ""},
    {Share::messageLogBytes, "message log", "bytes", ""},
    {Share::identifiers, "identifiers", "identifiers", "max_custom_identifiers_per_user"},
    {Share::logLines, "log lines", "lines a second", ""},
    {Share::workers, "workers", "threads", ""},
    {Share::outboxBytes, "outbox", "bytes", ""},
}};

// What can be dropped piece by piece (events, posts, shared data) leaves such a part of the bytes to what else would
// end a connection: half messages and replies.
inline constexpr unsigned kLeftForMessages = 4;

// The most that one user may have of each.
struct UserShares {
  std::array<Adjustable<uint64_t>, static_cast<size_t>(Share::numberOfShares)> most{};
  [[nodiscard]] Adjustable<uint64_t>& operator[](Share share) { return most[static_cast<size_t>(share)]; }
  [[nodiscard]] uint64_t operator[](Share share) const { return most[static_cast<size_t>(share)]; }

  // What the settings say, and where they are silent a part of the memory (bytes) and descriptors that there are.
  [[nodiscard]] static UserShares of(const Limits& limits, uint64_t memory, uint64_t descriptors);
};

class UserAccount {
 public:
  UserAccount(uint32_t user, const UserShares& shares) : user_(user), shares_(shares) {}
  UserAccount(const UserAccount&) = delete;
  UserAccount& operator=(const UserAccount&) = delete;

  [[nodiscard]] uint32_t user() const { return user_; }
  // Whether there was room, and a part of the share as large as one in `leaving` is left over (0: nothing); then it is
  // taken until it is given back.
  [[nodiscard]] bool take(Share share, uint64_t amount, unsigned leaving = 0);
  void takeAnyway(Share share, uint64_t amount) { held(share).fetch_add(amount, std::memory_order_relaxed); }
  void giveBack(Share share, uint64_t amount) { held(share).fetch_sub(amount, std::memory_order_relaxed); }
  [[nodiscard]] uint64_t holds(Share share) const {
    return held_[static_cast<size_t>(share)].load(std::memory_order_relaxed);
  }
  [[nodiscard]] uint64_t most(Share share) const { return shares_[share]; }
  [[nodiscard]] bool isOver(Share share) const { return holds(share) > most(share); }
  [[nodiscard]] bool holdsNothing() const;

 private:
  [[nodiscard]] std::atomic<uint64_t>& held(Share share) { return held_[static_cast<size_t>(share)]; }

  const uint32_t user_;
  const UserShares& shares_;
  std::array<std::atomic<uint64_t>, static_cast<size_t>(Share::numberOfShares)> held_{};
};

class UserBudget {
 public:
  explicit UserBudget(const UserShares& shares) : shares_(shares) {}
  // One that is made smaller takes nothing away from who has more, and gives nothing more.
  [[nodiscard]] UserShares& shares() { return shares_; }
  [[nodiscard]] uint64_t most(Share share) const { return shares_[share]; }
  // The user's one account. It is forgotten once nobody has it and it holds nothing.
  [[nodiscard]] std::shared_ptr<UserAccount> account(uint32_t user) EXCLUDES(mutex_);
  [[nodiscard]] size_t accountCount() const EXCLUDES(mutex_);

 private:
  UserShares shares_;
  mutable Mutex mutex_;
  std::unordered_map<uint32_t, std::shared_ptr<UserAccount>> accounts_ GUARDED_BY(mutex_);
  size_t sweepAt_ GUARDED_BY(mutex_) = 64;
};

// So much of a user's share, until it is destroyed. One thread at a time.
class Charge {
 public:
  Charge() = default;
  Charge(std::shared_ptr<UserAccount> account, Share share) : account_(std::move(account)), share_(share) {}
  Charge(Charge&& other) noexcept
      : account_(std::move(other.account_)), share_(other.share_), amount_(std::exchange(other.amount_, 0)) {}
  Charge& operator=(Charge&& other) noexcept;
  ~Charge() { clear(); }

  // False when the account has no room for what is more than before: then nothing has changed.
  // `leaving` as of UserAccount::take().
  [[nodiscard]] bool set(uint64_t amount, unsigned leaving = 0);
  [[nodiscard]] bool add(uint64_t amount) { return set(amount_ + amount); }
  void setAnyway(uint64_t amount);
  void clear() { setAnyway(0); }
  [[nodiscard]] uint64_t amount() const { return amount_; }
  // All of it, for another charge of the same share and account; this one goes on from zero.
  [[nodiscard]] Charge takeOut();

 private:
  std::shared_ptr<UserAccount> account_;
  Share share_ = Share::bytes;
  uint64_t amount_ = 0;
};

}  // namespace kyt
