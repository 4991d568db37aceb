#include "backend/BackendFactory.h"

#include "config/DeviceIdentity.h"
#include "platform/Bundle.h"
#include "platform/Platform.h"
#include "platform/base/Clock.h"
#include "platform/objects/Keys.h"
#include "platform/queues/Log.h"

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
    const String& name, const Dictionary& profile, const SharedSessionFacts& facts) {
  for (const BackendCreator& creator : creators_) {
    if (creator.name != name) continue;
    if (isExcludedOnThisDevice(name)) break;
    return creator.create(name, profile, facts);
  }
  configuration_.platform.log.error("KYTReportingBackend(newBackendWithName): %s", name.c_str());
  return nullptr;
}

SharedSessionFacts DefaultBackendFactory::factsOf(const Dictionary& sessionInfo, const String& udid) const {
  Platform& platform = configuration_.platform;
  DeviceIdentity& device = configuration_.deviceIdentity;
  auto facts = std::make_shared<SessionFacts>();
  facts->setStartTimestamp(platform.clock.timeOfDay());
  facts->productVersion = device.productVersion();
  facts->buildVersion = device.buildVersion();
  facts->hardwareType = device.productType();
  facts->productFamily = device.deviceName();
  facts->isInternal = device.isInternalBuild();
  facts->udid = udid;
  facts->setSelfVersion(platform.daemonBundle.version().value_or(String("8.0")));
  facts->sessionID = entryOf(sessionInfo, kKYTReportingSessionInfoSessionID).unsignedIntValue();
  facts->compType = entryOf(sessionInfo, kKYTReportingSessionInfoClientType).intValue();
  facts->clientVersion =
      static_cast<uint16_t>(entryOf(sessionInfo, kKYTReportingSessionInfoClientVersion).intValue());
  facts->requireUserInfo = entryOf(sessionInfo, kKYTReportingSessionInfoRequireUserInfo).boolValue();
  facts->batchEvents = entryOf(sessionInfo, kKYTReportingSessionInfoBatchEvent).boolValue();
  return facts;
}

std::optional<Backends> DefaultBackendFactory::createBackends(const std::optional<Dictionary>& table,
                                                              const std::optional<Dictionary>& sessionInfo,
                                                              const std::optional<Dictionary>& userInfo,
                                                              const String& udid) {
  Log& log = configuration_.platform.log;
  if (!table) {
    log.error("createBackends: Attempted to create backends with nil storebag");
    return std::nullopt;
  }
  if (!sessionInfo) {
    log.error("createBackends: Attempted to create backends with nil session info");
    return std::nullopt;
  }
  const SharedSessionFacts facts = factsOf(*sessionInfo, udid);
  Backends backends;
  for (const DictionaryEntry& entry : *table) {
    const Dictionary* profile = entry.value.dictionary();
    std::shared_ptr<KYTReportingBackend> backend =
        newBackendWithName(entry.key, profile != nullptr ? *profile : Dictionary(), facts);
    if (backend == nullptr) continue;
    backend->setUserInfoDict(userInfo);  // a session may change it, so it is none of the facts
    backends.add(entry.key, std::move(backend));
  }
  return backends;
}

}  // namespace kyt
