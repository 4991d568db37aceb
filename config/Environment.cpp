#include "config/Environment.h"

#include "config/DeviceIdentity.h"
#include "platform/UserDefaults.h"
#include "platform/queues/Log.h"

namespace kyt {

std::optional<String> environmentName(uint32_t number) {
  switch (number) {
    case kEnvironmentDevelopment:
      return String("development");
    case kEnvironmentInternal:
      return String("vantu_internal");
    case kEnvironmentSeed:
      return String("seed");
    case kEnvironmentRelease:
      return String("release");
    default:
      return std::nullopt;
  }
}

uint32_t Environment::userDefaultsEnvironment() {
  const Value stored = platform_.userDefaults.value(kKYTReportingDefaultsDomain, "environmentType");
  uint32_t environment;
  if (!stored.isNull()) {
    environment = static_cast<uint32_t>(stored.intValue());
    if (environment > kEnvironmentRelease) {
      platform_.log.error("userDefaultsEnvironment: Invalid environment type %u", environment);
      environment = kEnvironmentInternal;
    }
  } else {
    environment = deviceIdentity_.isInternalBuild() ? kEnvironmentInternal : kEnvironmentRelease;
  }
  platform_.log.normal("userDefaultsEnvironment: Environment type %u", environment);
  environment_.store(environment, std::memory_order_relaxed);
  return environment;
}

String Environment::storebagServerURL() {
  std::optional<String> base = stringUserDefault("kytreporting_storebag_url");
  {
    MutexLock lock(mutex_);
    storebagServerURL_ = base;
  }
  if (base) return *base;
  if (deviceIdentity_.isInternalBuild()) return String(hosts_.internalHost + "/storebags/tolvar");
  return String(hosts_.publicHost + "/bags/tolvar");
}

std::optional<String> Environment::stringUserDefault(std::string_view key) {
  const Value stored = platform_.userDefaults.value(kKYTReportingDefaultsDomain, key);
  if (const String* text = stored.string()) return *text;
  return std::nullopt;
}

}  // namespace kyt
