// What the program's threads have queued for the daemon: messages in a bounded ring; calls in the same ring, and behind
// it when it is full, so that a program that floods the queue still gets its calls through, in order. Knows until
// when the completions of the calls in it wait for a daemon.
//
// Threads: push…(), accepted() and messages() any thread, without a lock but for a call that finds the ring full; everything else the
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

    // Also a call with one, unless its time was over.
    [[nodiscard]] bool isMessage() const { return !command || (command->isMessage() && command->given); }
  };

  // Room for so many items (64 to 65536, rounded up to a power of two) and so many bytes of messages (at least 4096).
  OutgoingQueue(size_t maxMessages, size_t maxBytes);
  OutgoingQueue(const OutgoingQueue&) = delete;
  OutgoingQueue& operator=(const OutgoingQueue&) = delete;

  // False, and nothing is kept, when there is no room.
  [[nodiscard]] bool pushMessage(MessageArguments&& message);
  // Null when it was taken; the command itself when there is no room.
  [[nodiscard]] std::unique_ptr<Command> pushCommand(std::unique_ptr<Command> command);
  // The messages that were taken since the beginning, alone and in calls; and those of them that are in the queue now and
  // will be sent. Exact where nothing is in motion.
  [[nodiscard]] uint64_t accepted() const { return accepted_.load(std::memory_order_relaxed); }
  [[nodiscard]] uint64_t messages() const {
    const uint64_t left = left_.load(std::memory_order_acquire), taken = accepted();
    return taken > left ? taken - left : 0;  // one may leave before it is counted
  }

  // The next in order; false: there is none.
  bool pop(Item& item) REQUIRES(libraryThread);
  [[nodiscard]] bool isEmpty() const REQUIRES(libraryThread) {
    return ring_.empty() && overflowed_.load() == 0;
  }

  struct Expired {
    std::vector<Answer> answers;
    uint64_t messages = 0;  // of those whose answers these are, and which are not sent any more
  };
  // The completions whose deadline has passed while no daemon was there; their commands stay where they stand. Costs
  // nothing until a deadline is near or a call was queued.
  [[nodiscard]] Expired takeExpired(SteadyTime now) REQUIRES(libraryThread);
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
  std::atomic<uint64_t> accepted_{0};
  std::atomic<size_t> overflowed_{0};
  std::atomic<bool> commandQueued_{false};  // since the deadlines were last looked at
  Mutex mutex_;
  std::deque<std::unique_ptr<Command>> overflow_ GUARDED_BY(mutex_);  // of commands that found the ring full

  // The library's thread; `left_` is read by any.
  void leaves(const Item& item) REQUIRES(libraryThread);
  std::atomic<uint64_t> left_{0};  // of the accepted
  SteadyTime nextDeadline_ GUARDED_BY(libraryThread) = SteadyTime::max();
};

}  // namespace kyt::client
