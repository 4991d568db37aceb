// Keeps what was recorded. One thread at a time.
#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "platform/PowerLog.h"

namespace kyt {

class FakePowerLog final : public PowerLog {
 public:
  struct Event {
    uint32_t agent;
    std::string name;
    Dictionary dictionary;
  };
  std::vector<Event> events;

  void registeredEvent(uint32_t agent, std::string_view event, const Dictionary& dictionary) override {
    events.push_back({agent, std::string(event), dictionary});
  }
};

}  // namespace kyt
