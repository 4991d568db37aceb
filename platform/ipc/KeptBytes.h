// What a connection has read and not handled: the beginning of a message, or messages that a turn left. It takes no more
// memory than that, and none when there is nothing; large ones count as bytes of the user. One thread at a time.
#pragma once

#include <cstddef>
#include <memory>
#include <span>
#include <string>
#include <utility>

#include "platform/base/UserBudget.h"

namespace kyt {

class KeptBytes {
 public:
  explicit KeptBytes(std::shared_ptr<UserAccount> account) : charge_(std::move(account), Share::bytes) {}

  [[nodiscard]] bool empty() const { return bytes_.empty(); }
  // Valid until the next change.
  [[nodiscard]] std::span<const std::byte> bytes() const { return std::as_bytes(std::span(bytes_)); }

  // How many bytes there must be before they are worth looking at; 0 when a message was handled.
  void need(size_t bytes) { needed_ = bytes; }
  // Whether a message is unfinished that was looked at.
  [[nodiscard]] bool needsMore() const { return needed_ != 0; }
  [[nodiscard]] bool mayHoldMessage() const { return !bytes_.empty() && bytes_.size() >= needed_; }

  // Before a read: puts them at the beginning of `buffer`, so that what is read stands behind them. Returns how many
  // they are, or 0 where they would take more than half of it.
  [[nodiscard]] size_t copyTo(std::span<std::byte> buffer) const;
  // Adds what was read where they were not copied. False when the user's share has no room.
  [[nodiscard]] bool append(std::span<const std::byte> read);
  // Keeps exactly these, which may be a part of bytes(), in place of what was kept. False as above.
  [[nodiscard]] bool keep(std::span<const std::byte> rest);
  void clear();

 private:
  std::string bytes_;
  size_t needed_ = 0;
  Charge charge_;
};

}  // namespace kyt
