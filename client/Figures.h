// What a session counts for KYTReporting::Statistics. Any thread; the figures are independent of each other.
#pragma once

#include <atomic>
#include <cstdint>

#include "kytreporting/KYTReporting.h"

namespace kyt::client {

class Figure {
 public:
  // Returns the figure before.
  uint64_t add(uint64_t more = 1) { return count_.fetch_add(more, std::memory_order_relaxed); }
  [[nodiscard]] uint64_t value() const { return count_.load(std::memory_order_relaxed); }

 private:
  std::atomic<uint64_t> count_{0};
};

// Each is explained at the field of this name in Statistics.
struct Figures {
  Figure sent, droppedQueueFull, lostOnConnectionEnd, droppedClosed, droppedInvalid, connections,
      waitedTooLong, replayFailed, sentUnconfigured;

  [[nodiscard]] KYTReporting::Statistics statistics(size_t queued) const {
    KYTReporting::Statistics all;
    all.sent = sent.value();
    all.droppedQueueFull = droppedQueueFull.value();
    all.lostOnConnectionEnd = lostOnConnectionEnd.value();
    all.droppedClosed = droppedClosed.value();
    all.droppedInvalid = droppedInvalid.value();
    all.connections = connections.value();
    all.queued = queued;
    all.waitedTooLong = waitedTooLong.value();
    all.replayFailed = replayFailed.value();
    all.sentUnconfigured = sentUnconfigured.value();
    return all;
  }
};

}  // namespace kyt::client
