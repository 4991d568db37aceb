// What the program's threads have queued for the daemon: messages in a bounded ring; calls in the same ring, and behind
// it when it is full, so that a program that floods the queue still gets its calls through, in order. Knows until
// when the completions of the calls in it wait for a daemon.
//
// Threads: push…() and size() any thread, without a lock but for a call that finds the ring full; everything else the
// library's thread.
#pragma once

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <memory>
#include <vector>

#include "client/Command.h"
#include "client/LibraryThread.h"
#include "client/MessageRing.h"
#include "platform/base/Mutex.h"

namespace kyt::client {

class OutgoingQueue {
 public:
  // A message, or a call in its place.
  struct Item {
    MessageArguments message;
    uint32_t bytes = 0;  // what the message counts for
    std::unique_ptr<Command> command;
  };

  // Room for so many items (64 to 65536, rounded up to a power of two) and so many bytes of messages (at least 4096).
  OutgoingQueue(size_t maxMessages, size_t maxBytes);
  OutgoingQueue(const OutgoingQueue&) = delete;
  OutgoingQueue& operator=(const OutgoingQueue&) = delete;

  // False, and nothing is kept, when there is no room.
  [[nodiscard]] bool pushMessage(MessageArguments&& message);
  // Null when it was taken; the command itself when there is no room.
  [[nodiscard]] std::unique_ptr<Command> pushCommand(std::unique_ptr<Command> command);
  // A snapshot, possibly stale.
  [[nodiscard]] size_t size() const { return ring_.size() + overflowed_.load(std::memory_order_relaxed); }

  // The next in order; false: there is none.
  bool pop(Item& item) REQUIRES(libraryThread);
  [[nodiscard]] bool isEmpty() const REQUIRES(libraryThread) {
    return ring_.empty() && overflowed_.load() == 0;
  }

  // The completions whose deadline has passed while no daemon was there; their commands stay where they stand. Costs
  // nothing until a deadline is near or a call was queued.
  [[nodiscard]] std::vector<Answer> takeExpired(SteadyTime now) REQUIRES(libraryThread);
  // A daemon is there: no deadline counts until lookAgain().
  void suspendDeadlines() REQUIRES(libraryThread) { commandQueued_.store(false); }
  void lookAgain() REQUIRES(libraryThread) { commandQueued_.store(true); }
  // Whether takeExpired() has to look at calls that it has not seen yet.
  [[nodiscard]] bool hasNewCommand() const { return commandQueued_.load(); }
  // The nearest deadline as the last takeExpired() saw it, or max().
  [[nodiscard]] SteadyTime nextDeadline() const REQUIRES(libraryThread) { return nextDeadline_; }

 private:
  const size_t maxBytes_;

  // Any thread.
  MessageRing<Item> ring_;
  std::atomic<size_t> bytes_{0};
  std::atomic<size_t> overflowed_{0};
  std::atomic<bool> commandQueued_{false};  // since the deadlines were last looked at
  Mutex mutex_;
  std::deque<std::unique_ptr<Command>> overflow_ GUARDED_BY(mutex_);  // of commands that found the ring full

  // The library's thread.
  SteadyTime nextDeadline_ GUARDED_BY(libraryThread) = SteadyTime::max();
};

}  // namespace kyt::client
