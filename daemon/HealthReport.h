// The per-type figures of a health report while it is being added up: how many sessions of each short code
// there are and how many bytes of events they hold in batches. Thousands of sessions may be counted for one
// message, so the texts of the keys are made once, at the end.
#pragma once

#include <array>
#include <cstdint>
#include <vector>

#include "config/ClientTypes.h"
#include "platform/Value.h"

namespace kyt {

class HealthReport {
 public:
  // The code of types 5 to 23; all others count as "Unknown".
  void addSession(int32_t clientType, uint64_t batchedEventsSize);
  // "SessionsCount_QH", "BatchSize_QH" and so on, in the order in which the codes came up.
  void write(Dictionary& payload) const;

 private:
  static constexpr size_t kUnknown = kNumberOfClientTypes;
  struct Figures {
    uint32_t sessions = 0;
    uint64_t batchSize = 0;
  };
  std::array<Figures, kNumberOfClientTypes + 1> figures_{};
  std::vector<size_t> order_;
};

}  // namespace kyt
