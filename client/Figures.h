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

// A figure of Statistics, and the reason that debug lines and documents give to it; none for what is no loss.
struct NamedFigure {
  uint64_t KYTReporting::Statistics::*figure;
  const char* reason;
};
// The one table of the reasons for which a message may be lost on this side of the socket, and of the library's other
// failures.
inline constexpr NamedFigure kLosses[] = {
    {&KYTReporting::Statistics::droppedQueueFull, "queue-full"},
    {&KYTReporting::Statistics::droppedClosed, "session-closed"},
    {&KYTReporting::Statistics::droppedInvalid, "invalid"},
    {&KYTReporting::Statistics::lostOnConnectionEnd, "connection-ended"},
    {&KYTReporting::Statistics::lostInQueue, "session-ended"},
    {&KYTReporting::Statistics::droppedUnsendable, "unsendable"},
    {&KYTReporting::Statistics::droppedTooLate, "too-late"},
    {&KYTReporting::Statistics::waitedTooLong, "waited-too-long"},
    {&KYTReporting::Statistics::replayFailed, "replay-failed"},
    {&KYTReporting::Statistics::sentUnconfigured, "not-configured"},
};
inline constexpr uint64_t KYTReporting::Statistics::*kOtherFigures[] = {
    &KYTReporting::Statistics::sent, &KYTReporting::Statistics::queued, &KYTReporting::Statistics::accepted,
    &KYTReporting::Statistics::connections};

inline void addTo(KYTReporting::Statistics& sum, const KYTReporting::Statistics& more) {
  for (const NamedFigure& loss : kLosses) sum.*loss.figure += more.*loss.figure;
  for (const auto figure : kOtherFigures) sum.*figure += more.*figure;
}

// Each is explained at the field of this name in Statistics. Accepted messages are counted by the queue.
struct Figures {
  Figure written, droppedQueueFull, lostOnConnectionEnd, droppedClosed, droppedInvalid, connections,
      waitedTooLong, replayFailed, sentUnconfigured, lostInQueue, droppedUnsendable, droppedTooLate;

  [[nodiscard]] KYTReporting::Statistics statistics(uint64_t accepted, uint64_t queued) const {
    KYTReporting::Statistics all;
    all.lostOnConnectionEnd = lostOnConnectionEnd.value();
    all.sent = written.value() - all.lostOnConnectionEnd;
    all.droppedQueueFull = droppedQueueFull.value();
    all.droppedClosed = droppedClosed.value();
    all.droppedInvalid = droppedInvalid.value();
    all.connections = connections.value();
    all.accepted = accepted;
    all.queued = queued;
    all.waitedTooLong = waitedTooLong.value();
    all.replayFailed = replayFailed.value();
    all.sentUnconfigured = sentUnconfigured.value();
    all.lostInQueue = lostInQueue.value();
    all.droppedUnsendable = droppedUnsendable.value();
    all.droppedTooLate = droppedTooLate.value();
    return all;
  }
};

}  // namespace kyt::client
