#include "tools/feed/Event.h"

#include <algorithm>
#include <array>
#include <cmath>

#include "tools/KeyRules.h"

namespace kyt::tools {
namespace {

constexpr int64_t kLast16 = 65535;

constexpr std::array kKeys = {KeyRule{"method", KeyKind::number, true, 0, kLast16},
                              KeyRule{"respCode", KeyKind::number, true, 0, kLast16},
                              KeyRule{"event", KeyKind::number, false, 0, kLast16},
                              KeyRule{"time", KeyKind::real}, KeyRule{"message", KeyKind::object}};

// Rounded: 5.004 is a little less than that as a binary number, and is meant as 5.004.
TimeValue timeFrom(double time) {
  constexpr int64_t kMicrosecondsInSecond = 1000000;
  constexpr double kMostSeconds = 1e12;
  const int64_t microseconds = std::llround(std::clamp(time, -kMostSeconds, kMostSeconds) *
                                            static_cast<double>(kMicrosecondsInSecond));
  int64_t seconds = microseconds / kMicrosecondsInSecond;
  if (microseconds % kMicrosecondsInSecond < 0) --seconds;
  return {seconds, static_cast<int32_t>(microseconds - seconds * kMicrosecondsInSecond)};
}

}  // namespace

std::variant<FedEvent, std::string> eventFrom(const std::string& line, JSON& json) {
  const auto parsed = json.parse(line);
  if (const auto* error = std::get_if<Error>(&parsed)) return error->localizedDescription;
  const Dictionary* object = std::get<Value>(parsed).dictionary();
  if (object == nullptr) return "it must be an object";
  if (auto problem = problemIn(*object, kKeys)) return std::move(*problem);
  FedEvent event;
  event.method = static_cast<uint16_t>(object->find("method")->intValue());
  event.respCode = static_cast<uint16_t>(object->find("respCode")->intValue());
  if (const Value* number = object->find("event")) event.number = static_cast<uint16_t>(number->intValue());
  if (const Value* time = object->find("time")) event.time = timeFrom(time->doubleValue());
  if (const Value* message = object->find("message")) event.message = *message->dictionary();
  return event;
}

}  // namespace kyt::tools
