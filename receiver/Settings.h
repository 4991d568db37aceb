// What the configuration file of kytreceiver says. Read once by main(), constant afterwards.
#pragma once

#include <chrono>
#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

namespace kyt::receiver {

// An address of this machine and a port; port 0: any free one.
struct ListenAddress {
  std::string address;
  uint16_t port = 0;
  friend bool operator==(const ListenAddress&, const ListenAddress&) = default;
};

enum class LogKind { nats, kafka };

struct LogSettings {
  LogKind kind = LogKind::nats;
  std::vector<std::string> servers;
  std::string stream = "kyt-events";
  uint32_t partitions = 1;
  std::chrono::milliseconds publishTime{2000};  // then a post goes to the spool
  std::string caFile;                           // of the log's servers, for TLS; empty: the system's
  std::string credentials;                      // file of credentials; empty: none
  uint64_t maxBodyBytes = 17825792;             // of the posts that come: a log that takes less is said to
  // What --make-streams and --update-streams make.
  int replicas = 1;
  int64_t maxBytes = -1;  // of the stream; -1: no limit
  // Then a post leaves the log, whether somebody has read it or not. 0: never. Long enough for a reader that is away over a
  // holiday, and short enough for disks.
  std::chrono::seconds maxAge{7 * 86400};
};

enum class DigestPolicy { required, optional, none };

struct PathSettings {
  std::string urlPath;
  DigestPolicy digest = DigestPolicy::none;
  // By "SENDER/CLIENT": the keys, of which any counts.
  std::map<std::string, std::vector<std::string>, std::less<>> digestKeys;
};

struct Settings {
  ListenAddress listen{"127.0.0.1", 8480};
  std::optional<ListenAddress> metrics;
  std::string certificateFile, keyFile;  // both or none: HTTPS
  LogSettings log;
  std::string spoolPath;
  uint64_t spoolMaxBytes = uint64_t{1} << 30;
  uint64_t maxBodyBytes = 17825792;
  std::chrono::seconds bodyTime{60};  // for a post to be whole: a slow device holds a connection no longer
  // A connection without a request's headers. Longer than proxies keep their connections to us (nginx: 60 s), so that it
  // is them who end an idle one, and never with a post on its way.
  std::chrono::seconds idleTime{75};
  std::vector<PathSettings> paths;
};

// All that is wrong, a line each: "FILE:LINE: what".
struct SettingsErrors {
  std::vector<std::string> lines;
};

[[nodiscard]] std::variant<Settings, SettingsErrors> readSettings(const std::string& file);
[[nodiscard]] std::variant<Settings, SettingsErrors> parseSettings(std::string_view text,
                                                                   std::string_view name);

// "127.0.0.1:8480", "[::1]:8480"
[[nodiscard]] std::optional<ListenAddress> listenAddressFrom(std::string_view text);

}  // namespace kyt::receiver
