// Facts about the device by property key ("ProductVersion", "BuildVersion", "ProductType", "DeviceName",
// "HWModelStr", "SerialNumber", "UniqueDeviceID", "ReleaseType"), and what the locale and the time zone say. Any thread;
// may read small files; no answer is an ordinary outcome.
#pragma once

#include <optional>
#include <string_view>

#include "platform/base/Clock.h"
#include "platform/objects/Value.h"

namespace kyt {

class DeviceProperties {
 public:
  virtual ~DeviceProperties() = default;
  [[nodiscard]] virtual std::optional<String> property(std::string_view key) = 0;
  // The current locale's country code ("DE"), or none.
  [[nodiscard]] virtual std::optional<String> countryCode() = 0;
  // The local time zone's offset from GMT at that time, seconds, east positive. Cheap: called for every event.
  [[nodiscard]] virtual int64_t secondsFromGMT(TimeValue time) = 0;
};

// The device owner's consent to diagnostics-and-usage upload. No answer is no.
class DiagnosticsConsent {
 public:
  virtual ~DiagnosticsConsent() = default;
  [[nodiscard]] virtual bool isSubmissionAllowed() = 0;
  // Another number after each time that it was withdrawn, perhaps also at other times; never 0. What was collected by it
  // under another number may have been collected by one that was withdrawn and given again.
  [[nodiscard]] virtual uint64_t epoch() { return 1; }
};

}  // namespace kyt
