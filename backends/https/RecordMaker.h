// Makes the flat record of one event: the payload, and the fixed keys over it. Used by HTTPSPostBackend; constant after
// its construction, so any thread may use it.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string_view>

#include "backend/SessionFacts.h"
#include "config/Configuration.h"
#include "platform/base/Clock.h"
#include "platform/objects/Value.h"

namespace kyt {

// Whether the record of an event has this key of its own: what a payload says under it is replaced.
[[nodiscard]] bool isRecordKey(std::string_view key);

class RecordMaker {
 public:
  struct Event {
    TimeValue timestamp;
    uint16_t method = 0, respCode = 0;
    uint16_t number = 0;  // which of its back end's events it is
  };

  RecordMaker(const Configuration& configuration, SharedSessionFacts facts);

  // The payload of a message: what stands under its key, otherwise the whole message.
  [[nodiscard]] Dictionary takePayload(Dictionary& message) const;
  // `sessionID` is the combined one, which some client types replace by their session's number. `room` is how many more
  // entries the caller is going to merge.
  [[nodiscard]] Dictionary record(Dictionary payload, const Event& event,
                                  const std::optional<String>& sessionID, size_t room) const;

 private:
  [[nodiscard]] bool sendsNumber() const;

  const Configuration configuration_;
  const SharedSessionFacts facts_;
  const String reportVersion_;
};

}  // namespace kyt
