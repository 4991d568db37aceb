// The records that wait for a flush, how many of each method there are, and what they take. Used by HTTPSPostBackend,
// which keeps it on its state queue; by itself a plain value of one thread.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <utility>
#include <vector>

#include "backend/SessionIDPath.h"
#include "platform/base/Books.h"
#include "platform/objects/Value.h"

namespace kyt {

class MemoryInfo;

class EventBatch {
 public:
  struct Taken {
    Array records;
    BookedEvents events;  // the same, for the books
    uint64_t bytes = 0;   // as they were given to append()
  };

  // A batch exists from the first event that is to be batched until it is taken: a flush tells an empty one from none.
  [[nodiscard]] bool exists() const { return records_.has_value(); }
  void begin();
  void endIfEmpty();
  [[nodiscard]] size_t size() const { return records_ ? records_->size() : 0; }
  [[nodiscard]] uint64_t bytes() const { return bytes_; }
  // The records of a method, as the latest append() of it said.
  [[nodiscard]] int32_t count(int32_t method) const;

  // Whoever joins a hierarchy changes the identifiers of all sessions beneath, and holds the agent's monitor meanwhile:
  // so the records get the new one only when somebody reads or adds to them. These functions take the current one.
  void sessionIDChanged();
  // `tally`: in which the event is booked; null: in none.
  void append(Dictionary record, int32_t method, int32_t count, uint64_t bytes,
              const std::optional<SessionIDPath>& sessionID, Tally* tally = nullptr);
  [[nodiscard]] Taken take(const std::optional<SessionIDPath>& sessionID);
  // By the health report's estimate. The ends of other sessions ask too, so records that were sized before are not
  // sized again.
  [[nodiscard]] uint64_t sizeEstimate(const std::optional<SessionIDPath>& sessionID, MemoryInfo& memory);

 private:
  void writeSessionID(const std::optional<SessionIDPath>& sessionID);
  void forgetSizes();

  std::optional<Array> records_;
  std::vector<std::pair<int32_t, int32_t>> counts_;  // method, records of it; sorted
  BookedEvents events_;
  uint64_t bytes_ = 0;
  bool hasOldSessionID_ = false;
  size_t sizedRecords_ = 0;  // so many at the beginning have been sized
  uint64_t sizeOfRecords_ = 0;
};

}  // namespace kyt
