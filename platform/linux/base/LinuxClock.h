// The system's clocks.
#pragma once

#include "platform/base/Clock.h"

namespace kyt {

class LinuxClock final : public Clock {
 public:
  [[nodiscard]] TimeValue timeOfDay() const override;
  [[nodiscard]] MonotonicTime monotonic() const override;
  [[nodiscard]] Duration sinceBoot() const override;
};

}  // namespace kyt
