// Every fixed path of the daemon, in one place. A root (--root) stands in front of all of them, so that
// tests, demos and several daemons live side by side. Not under the root: /proc, /sys, /etc/localtime,
// /etc/os-release, /etc/machine-info, /etc/machine-id, and paths that are written in the settings.
#pragma once

#include <string>
#include <string_view>

namespace kyt {

struct Paths {
  // `root`: empty for none, otherwise a folder. `executableFolder`: where the running program is; without a
  // root the shared files are in ../share from there. Both absolute.
  [[nodiscard]] static Paths of(std::string_view root, std::string_view executableFolder);

  std::string root;   // without a trailing slash; empty for none
  std::string share;  // DIR/usr/share, or ../share from the executable

  [[nodiscard]] std::string configuration() const { return root + "/etc/kytreportingd"; }
  [[nodiscard]] std::string settings() const { return configuration() + "/kytreportingd.toml"; }
  [[nodiscard]] std::string entitlements() const { return configuration() + "/entitlements.d"; }
  [[nodiscard]] std::string device() const { return configuration() + "/device.toml"; }
  [[nodiscard]] std::string userDefaults() const { return root + "/var/lib/kytreportingd/defaults"; }
  [[nodiscard]] std::string outbox() const { return root + "/var/lib/kytreportingd/outbox"; }
  [[nodiscard]] std::string run() const { return root + "/run/kytreportingd"; }
  [[nodiscard]] std::string socket() const { return run() + "/com.vantu.kytreportingd"; }
  [[nodiscard]] std::string administration() const { return run() + "/admin"; }
  [[nodiscard]] std::string systemLogs() const { return root + "/var/mobile/Library/Logs/Faultbin"; }
  [[nodiscard]] std::string messageLogs() const { return systemLogs() + "/Retired"; }
  [[nodiscard]] std::string plugIns() const { return root + "/System/Library/PrivateFrameworks"; }
  [[nodiscard]] std::string kytShare() const { return share + "/kytreporting"; }
  [[nodiscard]] std::string clientBundle() const { return kytShare() + "/KYTReporting.bundle"; }
  [[nodiscard]] std::string daemonBundle() const { return kytShare() + "/kytreportingd.bundle"; }
};

}  // namespace kyt
