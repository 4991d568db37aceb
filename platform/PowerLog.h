// The platform's power-logging service: named events of numbered agents. Used by the back end that records
// there. Any thread; never waits for whoever keeps them; whether an event was kept is deliberately not told, since
// nobody would act on it.
#pragma once

#include <cstdint>
#include <string_view>

#include "platform/objects/Value.h"

namespace kyt {

class PowerLog {
 public:
  virtual ~PowerLog() = default;
  virtual void registeredEvent(uint32_t agent, std::string_view event, const Dictionary& dictionary) = 0;
};

}  // namespace kyt
