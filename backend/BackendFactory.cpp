#include "backend/BackendFactory.h"

#include "config/DeviceIdentity.h"
#include "platform/Clock.h"
#include "platform/Keys.h"
#include "platform/Log.h"
#include "platform/Platform.h"
#include "platform/System.h"

namespace kyt {

namespace {

// A missing entry reads as 0 and as false.
Value entryOf(const Dictionary& dictionary, const char* key) {
  const Value* value = dictionary.find(key);
  return value != nullptr ? *value : Value(0);
}

}  // namespace

DefaultBackendFactory::DefaultBackendFactory(Configuration& configuration,
                                             std::vector<BackendCreator> creators)
    : configuration_(configuration), creators_(std::move(creators)) {}

bool DefaultBackendFactory::isExcludedOnThisDevice(const String& name) const {
  return name == kKYTReportingBackendQDX && configuration_.deviceIdentity.productType() == String("Desktop");
}

std::shared_ptr<KYTReportingBackend> DefaultBackendFactory::newBackendWithName(
    const String& name, const Dictionary& profile, std::optional<String> productFamily, int32_t clientType) {
  for (const BackendCreator& creator : creators_) {
    if (creator.name != name) continue;
    if (isExcludedOnThisDevice(name)) break;
    return creator.create(name, profile, productFamily, clientType);
  }
  configuration_.platform.log.error("KYTReportingBackend(newBackendWithName): %s", name.c_str());
  return nullptr;
}

std::optional<Backends> DefaultBackendFactory::createBackends(const std::optional<Dictionary>& table,
                                                              const std::optional<Dictionary>& sessionInfo,
                                                              const std::optional<Dictionary>& userInfo,
                                                              const char* udid) {
  Platform& platform = configuration_.platform;
  DeviceIdentity& device = configuration_.deviceIdentity;
  if (!table) {
    platform.log.error("createBackends: Attempted to create backends with nil storebag");
    return std::nullopt;
  }
  if (!sessionInfo) {
    platform.log.error("createBackends: Attempted to create backends with nil session info");
    return std::nullopt;
  }
  const TimeValue startTime = platform.clock.timeOfDay();
  const std::optional<String> productVersion = device.productVersion();
  const std::optional<String> buildVersion = device.buildVersion();
  const std::optional<String> productType = device.productType();
  const std::optional<String> deviceName = device.deviceName();
  const bool isInternal = device.isInternalBuild();
  const String selfVersion = platform.daemonBundle.version().value_or(String("8.0"));
  const uint32_t sessionID = entryOf(*sessionInfo, kKYTReportingSessionInfoSessionID).unsignedIntValue();
  const int32_t clientType = entryOf(*sessionInfo, kKYTReportingSessionInfoClientType).intValue();
  const auto clientVersion =
      static_cast<uint16_t>(entryOf(*sessionInfo, kKYTReportingSessionInfoClientVersion).intValue());
  const bool requireUserInfo = entryOf(*sessionInfo, kKYTReportingSessionInfoRequireUserInfo).boolValue();
  const bool batchEvents = entryOf(*sessionInfo, kKYTReportingSessionInfoBatchEvent).boolValue();

  Backends backends;
  for (const DictionaryEntry& entry : *table) {
    const Dictionary* profile = entry.value.dictionary();
    std::shared_ptr<KYTReportingBackend> backend =
        newBackendWithName(entry.key, profile != nullptr ? *profile : Dictionary(), deviceName, clientType);
    if (backend == nullptr) continue;
    backend->setSessionID(sessionID);
    backend->setCompType(clientType);
    backend->setClientVersion(clientVersion);
    backend->setUdid(udid);
    backend->setProductVersion(productVersion);
    backend->setBuildVersion(buildVersion);
    backend->setHardwareType(productType);
    backend->setIsInternal(isInternal);
    backend->setRequireUserInfo(requireUserInfo);
    backend->setBatchEvents(batchEvents);
    backend->setUserInfoDict(userInfo);
    backend->setSelfVersion(selfVersion);
    backend->setStartTimestamp(startTime);
    backends.add(entry.key, std::move(backend));
  }
  return backends;
}

}  // namespace kyt
