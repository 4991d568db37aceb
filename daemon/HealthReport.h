// The per-type figures of a health report while it is being added up: how many sessions of each short code
// there are and how many bytes of events they hold in batches.
#pragma once

#include <array>
#include <cstdint>
#include <vector>

#include "config/ClientTypes.h"
#include "platform/objects/Value.h"

namespace kyt {

class HealthReport {
 public:
  static constexpr size_t kUnknown = kNumberOfClientTypes;
  static constexpr size_t kCodes = kNumberOfClientTypes + 1;
  [[nodiscard]] static size_t codeOf(int32_t clientType);

  // The code of types 5 to 23; all others count as "Unknown".
  void addSession(int32_t clientType, uint64_t batchedEventsSize);
  // Several of one code at once, the last of which holds `last` of their `sum`. Only for a code that has none yet.
  void addSessions(size_t code, uint32_t count, uint64_t sum, uint64_t last);
  // "SessionsCount_QH", "BatchSize_QH" and so on, in the order in which the codes came up.
  void write(Dictionary& payload) const;

 private:
  struct Figures {
    uint32_t sessions = 0;
    uint64_t batchSize = 0;
  };
  std::array<Figures, kCodes> figures_{};
  std::vector<size_t> order_;
};

}  // namespace kyt
