// Facts about the device that sessions and back ends stamp on their records, and the two values that are
// worked out once for the process. The composition root owns the one object. Any thread; may read small
// files; a fact that the platform cannot answer is none.
#pragma once

#include <cstdint>
#include <mutex>
#include <optional>
#include <string>

#include "platform/Platform.h"
#include "platform/objects/Value.h"

namespace kyt {

// A device identifier and its terminator.
inline constexpr int32_t kDeviceIDSize = 41;

class DeviceIdentity {
 public:
  explicit DeviceIdentity(Platform& platform) : platform_(platform) {}
  DeviceIdentity(const DeviceIdentity&) = delete;
  DeviceIdentity& operator=(const DeviceIdentity&) = delete;

  [[nodiscard]] std::optional<String> productVersion();
  [[nodiscard]] std::optional<String> buildVersion();
  [[nodiscard]] std::optional<String> productType();
  [[nodiscard]] std::optional<String> deviceName();
  [[nodiscard]] std::optional<String> hardwareModel();
  [[nodiscard]] std::optional<String> serialNumber();

  // The unique identifier as a C string of at most `size` bytes, terminator included. Without an answer, or
  // when it does not fit, the buffer is left as it was.
  void deviceUniqueIDCString(char* buffer, int32_t size);

  // Asked of the platform once; the answer holds for the life of the process.
  [[nodiscard]] bool isInternalBuild();
  // A random UUID, the same at every call.
  [[nodiscard]] const std::string& processInstanceUUID();

 private:
  Platform& platform_;
  std::once_flag internalBuildOnce_;
  bool internalBuild_ = false;  // constant after internalBuildOnce_
  std::once_flag instanceOnce_;
  std::string instanceUUID_;  // constant after instanceOnce_
};

}  // namespace kyt
