#include "daemon/RefusedClients.h"

#include <chrono>

namespace kyt {

bool RefusedClients::mayTell(uint32_t user, MonotonicTime now) {
  MutexLock lock(mutex_);
  std::erase_if(told_, [now](const auto& entry) { return now - entry.second >= std::chrono::minutes(1); });
  if (told_.size() >= kMostUsers) return false;
  return told_.emplace(user, now).second;
}

}  // namespace kyt
