// One line of kytfeed's input.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <variant>

#include "platform/JSON.h"
#include "platform/base/Clock.h"
#include "platform/objects/Value.h"

namespace kyt::tools {

struct FedEvent {
  uint16_t method = 0, respCode = 0;
  std::optional<uint16_t> number;
  std::optional<TimeValue> time;
  Dictionary message;
};

// The event, or why the line is none.
[[nodiscard]] std::variant<FedEvent, std::string> eventFrom(const std::string& line, JSON& json);

}  // namespace kyt::tools
