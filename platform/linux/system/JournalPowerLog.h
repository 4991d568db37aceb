// Power-log events as structured journal entries: KYT_AGENT, KYT_EVENT, and KYT_DICTIONARY as JSON. Without a
// journal there is nobody to record them: then nothing happens, counted.
#pragma once

#include "platform/PowerLog.h"

namespace kyt {

class Counters;

class JournalPowerLog final : public PowerLog {
 public:
  explicit JournalPowerLog(Counters& counters) : counters_(counters) {}
  void registeredEvent(uint32_t agent, std::string_view event, const Dictionary& dictionary) override;

 private:
  Counters& counters_;
};

}  // namespace kyt
