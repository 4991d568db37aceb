#include "client/OutgoingQueue.h"

#include <algorithm>
#include <utility>

#include "client/WireSize.h"

namespace kyt::client {

namespace {

constexpr size_t kMaxOverflow = 4096;  // commands

}  // namespace

OutgoingQueue::OutgoingQueue(size_t maxMessages, size_t maxBytes)
    : maxBytes_(std::max<size_t>(maxBytes, 4096)), ring_(std::clamp<size_t>(maxMessages, 64, 65536)) {}

bool OutgoingQueue::pushMessage(MessageArguments&& message) {
  const auto bytes = static_cast<uint32_t>(std::min<size_t>(messageBytes(message.payload), UINT32_MAX));
  const size_t before = bytes_.fetch_add(bytes, std::memory_order_relaxed);
  if (before + bytes <= maxBytes_ && overflowed_.load(std::memory_order_relaxed) == 0 &&
      ring_.push({std::move(message), bytes, nullptr})) {
    accepted_.fetch_add(1, std::memory_order_relaxed);
    return true;
  }
  bytes_.fetch_sub(bytes, std::memory_order_relaxed);
  return false;
}

std::unique_ptr<Command> OutgoingQueue::pushCommand(std::unique_ptr<Command> command) {
  Item item;
  const bool isMessage = command->isMessage();
  item.command = std::move(command);
  // NOLINTBEGIN(bugprone-use-after-move): push() leaves what it refuses.
  if (overflowed_.load() > 0 || !ring_.push(std::move(item))) {
    MutexLock lock(mutex_);
    if (overflow_.size() < kMaxOverflow) {
      overflow_.push_back(std::move(item.command));
      overflowed_.fetch_add(1);
    }
  }
  if (isMessage && !item.command) accepted_.fetch_add(1, std::memory_order_relaxed);
  commandQueued_.store(true);
  return std::move(item.command);
  // NOLINTEND(bugprone-use-after-move)
}

bool OutgoingQueue::pop(Item& item) {
  if (ring_.pop(item)) {
    bytes_.fetch_sub(item.bytes, std::memory_order_relaxed);
    leaves(item);
    return true;
  }
  if (overflowed_.load() == 0) return false;
  MutexLock lock(mutex_);
  if (overflow_.empty()) return false;
  item = Item();
  item.command = std::move(overflow_.front());
  overflow_.pop_front();
  overflowed_.fetch_sub(1);
  leaves(item);
  return true;
}

void OutgoingQueue::leaves(const Item& item) {
  if (item.isMessage()) left_.fetch_add(1, std::memory_order_release);
}

OutgoingQueue::Expired OutgoingQueue::takeExpired(SteadyTime now) {
  Expired late;
  if (!commandQueued_.exchange(false) && now < nextDeadline_) return late;
  nextDeadline_ = SteadyTime::max();
  const auto look = [&](const std::unique_ptr<Command>& command) {
    libraryThread.assertCurrent();
    if (!command || !command->deadline) return;
    if (*command->deadline > now) {
      nextDeadline_ = std::min(nextDeadline_, *command->deadline);
      return;
    }
    command->deadline.reset();
    command->given = command->staysGiven();
    late.answers.push_back(std::exchange(command->call.answer, {}));
    if (command->isMessage()) ++late.messages;
  };
  ring_.forEach([&look](const Item& item) { look(item.command); });
  MutexLock lock(mutex_);
  for (const auto& command : overflow_) look(command);
  left_.fetch_add(late.messages, std::memory_order_release);
  return late;
}

}  // namespace kyt::client
