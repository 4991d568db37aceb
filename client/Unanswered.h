// What was sent and has not been answered: calls with their answers; messages, which the daemon takes without a word; and
// the ping that is sent after them, whose reply says that they were taken. All of one connection, by serial; the daemon
// handles them in this order. The library's thread only.
#pragma once

#include <cstdint>
#include <deque>
#include <memory>
#include <optional>
#include <vector>

#include "client/Command.h"

namespace kyt::client {

class Unanswered {
 public:
  void addMessage(uint32_t serial);
  void addCall(uint32_t serial, std::unique_ptr<Command> command);
  void addPing(uint32_t serial, SteadyTime now);

  // How many messages nothing has acknowledged; calls do not count.
  [[nodiscard]] uint64_t messages() const { return unacknowledged_; }

  // When a ping is due, four a second at most, or as soon as many messages wait for one; none: no message does, or one is
  // on its way.
  [[nodiscard]] std::optional<SteadyTime> nextPing() const;

  // A reply came: it acknowledges the messages before it. Returns the call that it answers; none for a ping, and for what
  // nobody asked.
  [[nodiscard]] std::unique_ptr<Command> take(uint32_t replySerial);

  // The connection has ended: what was sent in vain.
  struct Left {
    uint64_t messages = 0;  // those in calls included
    std::vector<Answer> answers;
  };
  [[nodiscard]] Left takeAll();

 private:
  struct Pending {
    uint32_t serial;
    std::unique_ptr<Command> command;
  };
  struct Messages {
    uint32_t last;  // their serials end here, without a gap
    uint32_t count;
  };
  void acknowledge(uint32_t serial);

  std::deque<Pending> calls_;
  std::deque<Messages> messages_;
  uint64_t unacknowledged_ = 0;  // the sum of messages_
  std::optional<uint32_t> ping_;
  SteadyTime lastPing_{};
};

}  // namespace kyt::client
