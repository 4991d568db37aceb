#include "config/DeviceIdentity.h"

#include <cstring>

#include "platform/DeviceProperties.h"
#include "platform/RandomSource.h"
#include "platform/base/UUIDText.h"

namespace kyt {

std::optional<String> DeviceIdentity::productVersion() {
  return platform_.deviceProperties.property("ProductVersion");
}

std::optional<String> DeviceIdentity::buildVersion() {
  return platform_.deviceProperties.property("BuildVersion");
}

std::optional<String> DeviceIdentity::productType() {
  return platform_.deviceProperties.property("ProductType");
}

std::optional<String> DeviceIdentity::deviceName() {
  return platform_.deviceProperties.property("DeviceName");
}

std::optional<String> DeviceIdentity::hardwareModel() {
  return platform_.deviceProperties.property("HWModelStr");
}

std::optional<String> DeviceIdentity::serialNumber() {
  return platform_.deviceProperties.property("SerialNumber");
}

void DeviceIdentity::deviceUniqueIDCString(char* buffer, int32_t size) {
  const std::optional<String> identifier = platform_.deviceProperties.property("UniqueDeviceID");
  if (!identifier || size <= 0 || identifier->size() >= static_cast<size_t>(size)) return;
  std::memcpy(buffer, identifier->view().data(), identifier->size());
  buffer[identifier->size()] = '\0';
  buffer[size - 1] = '\0';
}

bool DeviceIdentity::isInternalBuild() {
  std::call_once(internalBuildOnce_, [this] {
    const std::optional<String> releaseType = platform_.deviceProperties.property("ReleaseType");
    internalBuild_ = releaseType && *releaseType == "Internal";
  });
  return internalBuild_;
}

const std::string& DeviceIdentity::processInstanceUUID() {
  std::call_once(instanceOnce_, [this] { instanceUUID_ = uuidText(platform_.random.uuidBytes()); });
  return instanceUUID_;
}

}  // namespace kyt
