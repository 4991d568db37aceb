// How a source's main thread sleeps: until it is told to end, until a descriptor has news, or until a time. Made before
// any other thread exists, so that none takes the signals by their default.
#pragma once

#include <chrono>
#include <optional>

#include "platform/base/Descriptor.h"

namespace kyt::sources {

class Waiting {
 public:
  using Time = std::chrono::steady_clock::time_point;
  enum class Woken { stop, news, time };
  Waiting();
  // False: the system gave no descriptor for the signals.
  [[nodiscard]] bool works() const { return static_cast<bool>(signals_); }
  // A descriptor below 0 has no news; without a time there is none. `stop` from the first SIGTERM or SIGINT on.
  [[nodiscard]] Woken wait(int descriptor, std::optional<Time> until);

 private:
  Descriptor signals_;
};

}  // namespace kyt::sources
