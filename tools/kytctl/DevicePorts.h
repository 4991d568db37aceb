// This device as a rehearsal asks about it (tools/explain/Rehearsal.h): the daemon's own readers of settings, user
// defaults, device properties and bundles, below a root. Nothing is written. What cannot be read is told, since its
// readers take it for missing.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/base/Counters.h"
#include "platform/base/Paths.h"
#include "platform/base/Settings.h"
#include "platform/fake/MemoryLogSink.h"
#include "platform/linux/base/LinuxClock.h"
#include "platform/linux/data/LinuxMemoryInfo.h"
#include "platform/linux/data/OpenSSLCryptography.h"
#include "platform/linux/data/PugixmlPropertyLists.h"
#include "platform/linux/data/RapidJSON.h"
#include "platform/linux/data/ZlibDeflate.h"
#include "platform/linux/device/LinuxDeviceProperties.h"
#include "platform/linux/device/TomlUserDefaults.h"
#include "platform/linux/toml/TomlBundle.h"
#include "platform/queues/Log.h"
#include "tools/explain/Rehearsal.h"

namespace kyt::tools {

class DevicePorts {
 public:
  // `root` as the daemon's --root. `withStorebagServer`: the settings are needed for more than their defaults.
  DevicePorts(const std::string& root, bool withStorebagServer);

  // As it is now. `verified`: false lets storebags without a signature pass.
  [[nodiscard]] RehearsedDevice device(bool verified);
  // "FILE: REASON", for each.
  [[nodiscard]] std::vector<std::string> unreadable() const;
  [[nodiscard]] const std::optional<Settings>& settings() const { return settings_; }
  [[nodiscard]] RapidJSON& json() { return json_; }
  [[nodiscard]] PugixmlPropertyLists& propertyLists() { return propertyLists_; }
  [[nodiscard]] Cryptography& cryptography() { return cryptography_; }

 private:
  void noteUnreadable(const std::string& path);

  const Paths paths_;
  std::vector<std::string> unreadable_;
  MemoryLogSink sink_;
  Log log_{sink_};
  Counters counters_;
  LinuxClock clock_;
  std::optional<Settings> settings_;
  OpenSSLCryptography cryptography_;
  PugixmlPropertyLists propertyLists_;
  RapidJSON json_;
  ZlibDeflate deflate_;
  LinuxMemoryInfo memory_;
  TomlUserDefaults userDefaults_;
  LinuxDeviceProperties deviceProperties_;
  DefaultsDiagnosticsConsent consent_;
  TomlBundle clientBundle_, daemonBundle_;
  std::unique_ptr<Cryptography> anySignature_;
  std::unique_ptr<Bundle> anyKey_;
};

}  // namespace kyt::tools
