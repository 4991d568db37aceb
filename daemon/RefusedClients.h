// Whose refusal is told at the default level: a user's clients once a minute, however often they try. Any thread.
#pragma once

#include <cstddef>
#include <cstdint>
#include <map>

#include "platform/base/Clock.h"
#include "platform/base/Mutex.h"

namespace kyt {

class RefusedClients {
 public:
  // Whether a line about a client of that user may be written now: none was within the last minute.
  [[nodiscard]] bool mayTell(uint32_t user, MonotonicTime now) EXCLUDES(mutex_);

 private:
  // Users told within the last minute; those beyond go untold, which only a machine with as many can notice.
  static constexpr size_t kMostUsers = 1024;

  Mutex mutex_;
  std::map<uint32_t, MonotonicTime> told_ GUARDED_BY(mutex_);
};

}  // namespace kyt
