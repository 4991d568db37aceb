// The deployment settings, as read from kytreportingd.toml (platform/linux/toml/TomlSettings.h) once at
// start-up. Constant afterwards but for what a reload takes up (daemon/DaemonReload.h); the composition root owns them and
// hands the parts down.
#pragma once

#include <string>
#include <vector>

#include "platform/base/Limits.h"
#include "platform/base/LogLevel.h"

namespace kyt {

enum class LogTarget { automatic, journal, standardError };
enum class CompressionLibrary { zlib, libdeflate };

// Of request bodies.
struct CompressionSettings {
  CompressionLibrary library = CompressionLibrary::zlib;
  int level = 6;  // 1 to 9: the quickest to the smallest
  friend bool operator==(const CompressionSettings&, const CompressionSettings&) = default;
};

// Of what could not be sent.
struct OutboxSettings {
  bool enabled = false;
  uint64_t maxBytes = 67108864;         // on disk: addresses, headers and bodies
  uint64_t maxAgeSeconds = 1209600;     // two weeks
  uint64_t maxBytesPerUser = 33554432;  // so no user fills it
  friend bool operator==(const OutboxSettings&, const OutboxSettings&) = default;
};

// Which storebags with a good signature are refused all the same. Off, nothing of this is looked at.
struct StorebagRefusals {
  bool older = false;          // a lower "serial" than one taken before, or none after one
  bool expired = false;        // its "expires" has passed
  bool withoutSHA256 = false;  // no "signature256" that verifies
  friend bool operator==(const StorebagRefusals&, const StorebagRefusals&) = default;
};

struct Settings {
  // Storebag hosts as addresses without a trailing slash ("https://bags.example.org"); the paths are
  // appended.
  std::string storebagInternalHost;
  std::string storebagPublicHost;
  StorebagRefusals storebagRefusals;
  std::string caFile;                           // PEM; empty: the system's
  std::vector<std::string> cellularInterfaces;  // glob patterns of interface names
  Limits limits;
  LogTarget logTarget = LogTarget::automatic;
  LogLevel logLevel = LogLevel::normal;
  CompressionSettings compression;
  std::string adminGroup;  // whose members may look at the daemon, by name; empty: none
  OutboxSettings outbox;
  friend bool operator==(const Settings&, const Settings&) = default;
};

}  // namespace kyt
