#include "client/Unanswered.h"

#include <algorithm>
#include <utility>

#include "kytreporting/KYTReporting.h"

namespace kyt::client {

namespace {

constexpr std::chrono::milliseconds kPingInterval{250};
constexpr uint64_t kPingAtOnce = KYTReporting::kMostUnacknowledged / 4;  // messages

}  // namespace

void Unanswered::addMessage(uint32_t serial) {
  if (messages_.empty() || messages_.back().last != serial - 1) messages_.push_back({0, 0});
  messages_.back().last = serial;
  ++messages_.back().count;
  ++unacknowledged_;
}

void Unanswered::addCall(uint32_t serial, std::unique_ptr<Command> command) {
  calls_.push_back({serial, std::move(command)});
}

void Unanswered::addPing(uint32_t serial, SteadyTime now) {
  ping_ = serial;
  lastPing_ = now;
}

std::optional<SteadyTime> Unanswered::nextPing() const {
  if (messages_.empty() || ping_) return std::nullopt;
  return unacknowledged_ >= kPingAtOnce ? lastPing_ : lastPing_ + kPingInterval;
}

std::unique_ptr<Command> Unanswered::take(uint32_t replySerial) {
  if (ping_ == replySerial) {
    ping_.reset();
    acknowledge(replySerial);
    return nullptr;
  }
  const auto found = std::find_if(calls_.begin(), calls_.end(),
                                  [replySerial](const Pending& call) { return call.serial == replySerial; });
  if (found == calls_.end()) return nullptr;
  acknowledge(replySerial);
  std::unique_ptr<Command> command = std::move(found->command);
  calls_.erase(found);
  return command;
}

// Serials begin again after the last number there is.
void Unanswered::acknowledge(uint32_t serial) {
  while (!messages_.empty() && static_cast<int32_t>(messages_.front().last - serial) < 0) {
    unacknowledged_ -= messages_.front().count;
    messages_.pop_front();
  }
}

Unanswered::Left Unanswered::takeAll() {
  Left left;
  left.messages = std::exchange(unacknowledged_, 0);
  messages_.clear();
  for (Pending& call : std::exchange(calls_, {})) {
    if (call.command->isMessage()) ++left.messages;
    left.answers.push_back(std::move(call.command->call.answer));
  }
  ping_.reset();
  return left;
}

}  // namespace kyt::client
