#include "daemon/HealthReport.h"

#include "platform/objects/Description.h"
#include "platform/queues/Log.h"

namespace kyt {

size_t HealthReport::codeOf(int32_t clientType) {
  const bool reported = clientType >= kFirstReportedClientType && clientType <= kLastReportedClientType;
  return reported ? static_cast<size_t>(clientType) : kUnknown;
}

void HealthReport::addSession(int32_t clientType, uint64_t batchedEventsSize) {
  const size_t index = codeOf(clientType);
  Figures& figures = figures_[index];
  if (figures.sessions == 0) order_.push_back(index);
  ++figures.sessions;
  // What was there before is read as a 32-bit number.
  figures.batchSize = batchedEventsSize + static_cast<uint32_t>(figures.batchSize);
}

// As if each had been added: of what was there before each, only the last 32 bits count.
void HealthReport::addSessions(size_t code, uint32_t count, uint64_t sum, uint64_t last) {
  order_.push_back(code);
  figures_[code] = {count, last + static_cast<uint32_t>(sum - last)};
}

void HealthReport::write(Dictionary& payload) const {
  for (const size_t index : order_) {
    const char* code = index == kUnknown ? "Unknown" : clientTypeShortCode(static_cast<int32_t>(index));
    payload.set(formatObjects("%@_%@", {"SessionsCount", code}), figures_[index].sessions);
    payload.set(formatObjects("%@_%@", {"BatchSize", code}), figures_[index].batchSize);
  }
}

}  // namespace kyt
