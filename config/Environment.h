// In which of the four environments the daemon runs, and where its storebags come from. Both follow user
// defaults that an administrator may change while the daemon runs, so both are worked out at every call; the
// last results are kept. The composition root owns the one object. Any thread; reads block for a small file
// at most.
#pragma once

#include <atomic>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Platform.h"
#include "platform/base/Mutex.h"
#include "platform/objects/Value.h"

namespace kyt {

class DeviceIdentity;

inline constexpr uint32_t kEnvironmentDevelopment = 1;
inline constexpr uint32_t kEnvironmentInternal = 2;
inline constexpr uint32_t kEnvironmentSeed = 3;
inline constexpr uint32_t kEnvironmentRelease = 4;

// The section of the storebag; none for 0 and for what is no environment.
[[nodiscard]] std::optional<String> environmentName(uint32_t number);

// Where storebags come from unless a user default says otherwise: scheme and host, without a trailing slash.
struct StorebagHosts {
  std::string internalHost;  // internal builds
  std::string publicHost;    // all others
};

class Environment {
 public:
  Environment(Platform& platform, DeviceIdentity& deviceIdentity, StorebagHosts hosts)
      : platform_(platform), deviceIdentity_(deviceIdentity), hosts_(std::move(hosts)) {}
  Environment(const Environment&) = delete;
  Environment& operator=(const Environment&) = delete;

  // 0 to 4; 0 selects no section.
  uint32_t userDefaultsEnvironment();
  // What the last call of userDefaultsEnvironment() answered; 0 before the first.
  [[nodiscard]] uint32_t cachedEnvironment() const { return environment_.load(std::memory_order_relaxed); }

  // The base address, to which "/" and a storebag's name are appended.
  [[nodiscard]] String storebagServerURL();

  // The string stored for the key in the domain "com.vantu.kytreporting".
  [[nodiscard]] std::optional<String> stringUserDefault(std::string_view key);

 private:
  Platform& platform_;
  DeviceIdentity& deviceIdentity_;
  const StorebagHosts hosts_;
  std::atomic<uint32_t> environment_{0};
  Mutex mutex_;
  std::optional<String> storebagServerURL_ GUARDED_BY(mutex_);  // the user default, as last read
};

}  // namespace kyt
