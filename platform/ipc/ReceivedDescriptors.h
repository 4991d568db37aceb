// The descriptors that came on a connection and that no message has claimed yet, counted as descriptors of the user. They
// belong to messages in the order in which they came. One thread at a time.
#pragma once

#include <cstddef>
#include <memory>
#include <utility>
#include <vector>

#include "platform/base/Descriptor.h"
#include "platform/base/UserBudget.h"

namespace kyt {

class ReceivedDescriptors {
 public:
  explicit ReceivedDescriptors(std::shared_ptr<UserAccount> account)
      : charge_(std::move(account), Share::descriptors) {}

  // The end of the handshake: whether the client may pass any. Those that came before may belong to a message behind it;
  // from a client that may not, all are closed.
  void agree(bool agreed);
  // False when the user's clients hold too many.
  [[nodiscard]] bool add(std::vector<Descriptor> received);
  // Gives a message the first `count`. Returns null, or why the message is malformed.
  [[nodiscard]] const char* take(size_t count, std::vector<Descriptor>& taken);
  // Whether they are more than one message may carry.
  [[nodiscard]] bool tooManyForOneMessage() const;
  // Closes those that nobody claimed.
  void clear();

 private:
  std::vector<Descriptor> descriptors_;
  Charge charge_;
  bool wanted_ = true;
};

}  // namespace kyt
