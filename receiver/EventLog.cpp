#include "receiver/EventLog.h"

#include "platform/base/Hex.h"

namespace kyt::receiver {

uint32_t partitionOf(const std::string& id, uint32_t partitions) {
  if (partitions <= 1) return 0;
  uint32_t number = 0;
  for (size_t i = 0; i < 8 && i < id.size(); ++i)
    number = number * 16 + static_cast<uint32_t>(hexDigit(id[i]));
  return number % partitions;
}

}  // namespace kyt::receiver
