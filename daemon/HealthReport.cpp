#include "daemon/HealthReport.h"

#include "platform/Log.h"

namespace kyt {

void HealthReport::addSession(int32_t clientType, uint64_t batchedEventsSize) {
  const bool reported = clientType >= kFirstReportedClientType && clientType <= kLastReportedClientType;
  const size_t index = reported ? static_cast<size_t>(clientType) : kUnknown;
  Figures& figures = figures_[index];
  if (figures.sessions == 0) order_.push_back(index);
  ++figures.sessions;
  // What was there before is read as a 32-bit number.
  figures.batchSize = batchedEventsSize + static_cast<uint32_t>(figures.batchSize);
}

void HealthReport::write(Dictionary& payload) const {
  for (const size_t index : order_) {
    const char* code = index == kUnknown ? "Unknown" : clientTypeShortCode(static_cast<int32_t>(index));
    payload.set(formatObjects("%@_%@", {"SessionsCount", code}), figures_[index].sessions);
    payload.set(formatObjects("%@_%@", {"BatchSize", code}), figures_[index].batchSize);
  }
}

}  // namespace kyt
