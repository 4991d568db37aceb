// What the command line of the server says. Read once by main(), constant afterwards.
#pragma once

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>
#include <vector>

namespace kyt::devserver {

// A key that posts must be signed with: those of one client, or of every client that has no key of its own.
struct DigestKey {
  std::string client;  // empty: every client
  std::string key;     // the bytes
};

struct Options {
  std::filesystem::path state;      // certificates, database, lock
  std::filesystem::path bags;       // storebag files; empty: none are served
  std::filesystem::path signKey;    // a private key in PEM; empty: only signed storebags are served
  std::filesystem::path readyFile;  // empty: none is written
  std::string listen = "127.0.0.1";
  std::vector<std::string> hosts;  // names and addresses beyond those of loopback, for the certificate
  uint16_t httpsPort = 8443;
  uint16_t httpPort = 8080;
  std::optional<uint16_t> udpPort;  // of the dashboard feed; none: it is not taken
  bool httpEvents = false;          // take event posts and log data on the plain port too
  unsigned maxAge = 3600;           // seconds, of a storebag's Cache-Control
  std::vector<DigestKey> digestKeys;
  uint64_t maxBodyBytes = 16 << 20;      // of a post as sent
  uint64_t maxInflatedBytes = 64 << 20;  // of its JSON text
  std::chrono::seconds requestTimeout{60};
  uint64_t keepPosts = 10000;
  uint64_t keepBytes = uint64_t{1} << 30;
  unsigned maxConnections = 4096;  // of each port
};

}  // namespace kyt::devserver
