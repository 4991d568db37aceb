// Device properties from where Linux keeps them; each can be overridden by its key in device.toml, which is
// read again when it changes:
//
//   ProductVersion  os-release VERSION_ID            DeviceName      machine-info PRETTY_HOSTNAME, the host
//   name BuildVersion    os-release BUILD_ID,             HWModelStr      DMI board_name, device tree
//   "compatible"
//                   IMAGE_VERSION, kernel release    SerialNumber    DMI product_serial, device tree
//                   "serial-number"
//   ProductType     machine-info HARDWARE_MODEL,     UniqueDeviceID  the machine id, see below
//                   DMI product_name, device tree "model"            ReleaseType     device.toml alone
//
// The machine id itself is confidential and never leaves: UniqueDeviceID is the SHA-1, 40 lower-case hex
// digits, of the application-specific machine id in its usual text form (32 lower-case hex digits), which is
// the first half of HMAC-SHA-256(key: the machine id's 16 bytes, message: this application's 16 bytes) with
// the version and variant bits of a random UUID, as sd_id128_get_machine_app_specific makes it.
#pragma once

#include <atomic>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Cryptography.h"
#include "platform/DeviceProperties.h"
#include "platform/UserDefaults.h"
#include "platform/base/Clock.h"
#include "platform/base/Mutex.h"
#include "platform/linux/toml/FlatToml.h"
#include "platform/queues/Log.h"

namespace kyt {

// Where to look; the defaults are the system's own.
struct DeviceSources {
  std::string overrides;  // device.toml; empty: none
  std::string osRelease = "/etc/os-release";
  std::string machineInfo = "/etc/machine-info";
  std::string machineID = "/etc/machine-id";
  std::string dmi = "/sys/class/dmi/id";
  std::string deviceTree = "/sys/firmware/devicetree/base";
};

class LinuxDeviceProperties final : public DeviceProperties {
 public:
  LinuxDeviceProperties(DeviceSources sources, Cryptography& cryptography, Log& log, const Clock& clock);

  [[nodiscard]] std::optional<String> property(std::string_view key) override EXCLUDES(mutex_);
  [[nodiscard]] std::optional<String> countryCode() override EXCLUDES(mutex_);
  // Looked up once for each minute of `time`; a change of TZ or /etc/localtime counts from the next minute
  // on.
  [[nodiscard]] int64_t secondsFromGMT(TimeValue time) override;

  // The territory of a locale name ("de_DE.UTF-8" -> "DE"); none for "C", "POSIX" and names without one.
  [[nodiscard]] static std::optional<std::string> territory(std::string_view locale);

 private:
  std::optional<std::string> overridden(std::string_view key) EXCLUDES(mutex_);
  std::optional<std::string> uniqueDeviceID();

  const DeviceSources sources_;
  Cryptography& cryptography_;
  Log& log_;
  std::atomic<uint64_t> offset_ = 0;  // minute << 24 | (offset + kOffsetBias); 0: not looked up yet
  Mutex zoneMutex_;                   // around the C library's look-up
  Mutex mutex_;
  FlatTomlFile overrides_ GUARDED_BY(mutex_);
};

// Every key that device.toml may have.
[[nodiscard]] std::vector<std::string> devicePropertyKeys();

// The user default "consent" of the diagnostics domain; no value is no. Its epoch is another one whenever the domain's file
// was written, since that may have been for no and yes.
class DefaultsDiagnosticsConsent final : public DiagnosticsConsent {
 public:
  // `file`: the domain's; empty: its epoch is of no interest.
  explicit DefaultsDiagnosticsConsent(UserDefaults& defaults, std::string file = "")
      : defaults_(defaults), file_(std::move(file)) {}
  [[nodiscard]] bool isSubmissionAllowed() override {
    return defaults_.value(kDiagnosticsDefaultsDomain, "consent").boolValue();
  }
  [[nodiscard]] uint64_t epoch() override;

 private:
  UserDefaults& defaults_;
  const std::string file_;
};

}  // namespace kyt
