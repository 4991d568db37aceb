#include "platform/ipc/ReceivedDescriptors.h"

#include <iterator>

#include "platform/base/Limits.h"

namespace kyt {

void ReceivedDescriptors::agree(bool agreed) {
  wanted_ = agreed;
  if (!wanted_) clear();
}

bool ReceivedDescriptors::add(std::vector<Descriptor> received) {
  if (!wanted_ || received.empty()) return true;
  for (Descriptor& descriptor : received) descriptors_.push_back(std::move(descriptor));
  return charge_.set(descriptors_.size());
}

const char* ReceivedDescriptors::take(size_t count, std::vector<Descriptor>& taken) {
  if (count > Limits::maxDescriptorsPerMessage) return "a message claims more descriptors than it may carry";
  if (count > descriptors_.size()) return "a message claims descriptors that did not come";
  const auto end = descriptors_.begin() + static_cast<std::ptrdiff_t>(count);
  taken.assign(std::make_move_iterator(descriptors_.begin()), std::make_move_iterator(end));
  descriptors_.erase(descriptors_.begin(), end);
  charge_.setAnyway(descriptors_.size());  // less than before
  return nullptr;
}

bool ReceivedDescriptors::tooManyForOneMessage() const {
  return descriptors_.size() > Limits::maxDescriptorsPerMessage;
}

void ReceivedDescriptors::clear() {
  if (descriptors_.empty()) return;
  descriptors_.clear();
  charge_.clear();
}

}  // namespace kyt
