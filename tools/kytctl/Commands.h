// The commands of kytctl: each takes what the command line said and returns the exit status: 0 done, 1 it
// could not be done (with a line on standard error), 2 wrong usage. Output for people and scripts goes to
// standard output.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "platform/base/Error.h"

namespace kyt::tools {

struct ConnectionOptions {
  std::string root;    // in front of every fixed path, as the daemon's --root
  std::string socket;  // instead of the fixed one
  double timeoutSeconds = 30;
};

struct SendOptions {
  int clientType = 0;
  uint32_t sessionID = 1;
  uint16_t clientVersion = 1;
  std::optional<uint16_t> category, type;
  std::string payloadJSON = "{}";
  std::string userInfoJSON;  // empty: none
  bool requireUserInfo = false;
  bool fromStandardInput = false;  // many events, of one session
  bool quietIfNoDaemon = false;
};

struct ListenOptions {
  std::string socket;
  std::string live = "httppost";  // names, parted by commas
  bool noStorebag = false, refuse = false;
  uint64_t dieAfter = 0;  // messages; 0: never
};

struct SignOptions {
  std::string bag;                        // .json, .toml or .plist
  std::string key;                        // private key, PEM
  std::string output;                     // "-": standard output
  std::optional<uint32_t> serial;         // instead of the bag's own
  std::optional<uint32_t> expiresInDays;  // likewise
};

struct PublishOptions {
  SignOptions sign;    // without an output
  std::string folder;  // that a server hands out
  std::string name;    // of the storebag; empty: the bag's file's
};

struct ProbeOptions {
  std::string url;                // of the storebag, without "?version="
  std::string publicKey, caFile;  // empty: the device's
};

struct RingOptions {
  std::string identifier;  // of a device; empty: this one's
  std::string address;     // with "{ring}" in it; empty: only tells the ring
};

struct CheckOptions {
  int32_t pid = 0;      // of a client, or
  std::string user;     // a name or a number: any client of that user,
  std::string program;  // which runs this program file; empty: any
};

struct ExplainOptions {
  std::string event;  // JSON, or "-": standard input
  int clientType = 0;
  uint32_t sessionID = 1;
  uint16_t clientVersion = 1;
  std::string client, service;  // names; empty: none
  std::string userInfoJSON;     // instead of the two
  std::string sessionInfoJSON;  // instead of the four before
  bool requireUserInfo = false, batch = false, single = false;
  std::string storebag;  // a file; empty: the running daemon's, or the server's
  bool fetch = false;    // the server's, also where a daemon has one
  CheckOptions program;  // neither process nor user: any process of the user who asks
  double draw = -1;      // below 0: all are tried
  bool json = false;
};

struct WatchOptions {
  std::string user;                   // a name or a number; empty: all
  std::optional<std::string> client;  // empty: those without a name
  std::optional<uint16_t> category;
  bool bodies = false;
  bool json = false;
};

struct MetricsOptions {
  bool textFormat = false;  // the older one, without units and without an end
  bool json = false;
};

struct OutboxDropOptions {
  std::string server, user;  // the user by name or number; empty: any
  bool all = false;          // meant so where neither is given
  bool json = false;
};

struct EventsOptions {
  std::string file;  // events.toml
  std::string bag;   // a document, or a bag: .json, .toml or .plist
  bool json = false;
};

struct GenerateOptions {
  std::string file;          // events.toml
  std::string language;      // "c", "c++", "python"; of a page: none
  std::string output = "-";  // "-": standard output
};

struct SimulateOptions {
  std::string bag, events;  // files
  uint32_t devices = 1000;
  uint64_t seed = 1;
  bool json = false;
};

[[nodiscard]] int sendCommand(const ConnectionOptions& connection, const SendOptions& options);
[[nodiscard]] int sessionCommand(const ConnectionOptions& connection, const std::string& script);

// Stands in for the daemon until SIGINT or SIGTERM, or its death: prints what programs tell it.
[[nodiscard]] int listenCommand(const ListenOptions& options);

[[nodiscard]] int defaultsReadCommand(const std::string& root, const std::string& domain,
                                      const std::string& key);
// `type`: string, integer, real, boolean; `value` none deletes the key.
[[nodiscard]] int defaultsWriteCommand(const std::string& root, const std::string& domain,
                                       const std::string& key, const std::string& type,
                                       const std::optional<std::string>& value);
// `change`: "show", "grant" or "withdraw".
[[nodiscard]] int consentCommand(const std::string& root, const std::string& change);

[[nodiscard]] int ownerShowCommand(const std::string& root, bool json);
// "-": standard output.
[[nodiscard]] int ownerExportCommand(const std::string& root, const std::string& file);
// Ends a daemon that runs, so that nothing is written back.
[[nodiscard]] int ownerEraseCommand(const std::string& root);

// Tells why a client is served (0) or refused (1); 2: that cannot be told.
[[nodiscard]] int entitlementsCheckCommand(const std::string& root, const CheckOptions& options);

// The same without output: what was looked at goes to `lines`. Exactly one of process and user is given.
[[nodiscard]] int checkEntitlement(const std::string& root, const CheckOptions& options,
                                   std::vector<std::string>& lines);

// Tells what becomes of an event on this device: it leaves (0), it does not (1), or that cannot be told (2).
[[nodiscard]] int explainCommand(const std::string& root, const ExplainOptions& options);

[[nodiscard]] int makeKeysCommand(const std::string& folder, unsigned bits);
[[nodiscard]] int signCommand(const SignOptions& options);
[[nodiscard]] int verifyCommand(const std::string& document, const std::string& publicKey);
// With a public key the signature is checked first.
[[nodiscard]] int showCommand(const std::string& document, const std::string& publicKey);

// Signs a bag and puts it where a server hands it out.
[[nodiscard]] int publishCommand(const PublishOptions& options);
// Tells what changes when one bag, signed or not, takes the place of another.
[[nodiscard]] int diffCommand(const std::string& before, const std::string& after);
// Asks a server for a storebag as the daemon does and tells what it gets wrong; 1: devices do not get it.
[[nodiscard]] int probeCommand(const std::string& root, const ProbeOptions& options);
// Tells in which of a hundred rings a device is, and lets it ask its ring's address from now on.
[[nodiscard]] int ringCommand(const std::string& root, const RingOptions& options);

// Tells what a program reports that a bag leaves unguarded or does not take: 0 nothing, 1 something; 2: that cannot be told.
[[nodiscard]] int checkEventsCommand(const EventsOptions& options);
// Writes source code that fills and sends these events.
[[nodiscard]] int generateEventsCommand(const GenerateOptions& options);
// Writes a page about them for people.
[[nodiscard]] int documentEventsCommand(const GenerateOptions& options);

// Tells how many sessions and events of many devices leave by that bag.
[[nodiscard]] int simulateCommand(const std::string& root, const SimulateOptions& options);

// What the running daemon says of itself, in columns or as one JSON object. 3: it does not run.
[[nodiscard]] int statusCommand(const std::string& root, bool json);
[[nodiscard]] int sessionsCommand(const std::string& root, bool json);
[[nodiscard]] int booksCommand(const std::string& root, bool json);
[[nodiscard]] int storebagsCommand(const std::string& root, bool json);
[[nodiscard]] int metricsCommand(const std::string& root, const MetricsOptions& options);
// Prints the level, or sets it first.
[[nodiscard]] int logLevelCommand(const std::string& root, const std::string& level, bool json);
// Prints events as they pass, until the daemon ends or this program is interrupted.
[[nodiscard]] int watchCommand(const std::string& root, const WatchOptions& options);
[[nodiscard]] int reloadCommand(const std::string& root, bool json);
// What could not be sent and waits on the disk.
[[nodiscard]] int outboxListCommand(const std::string& root, bool json);
[[nodiscard]] int outboxShowCommand(const std::string& root, const std::string& server, bool json);
[[nodiscard]] int outboxFlushCommand(const std::string& root, bool json);
[[nodiscard]] int outboxDropCommand(const std::string& root, const OutboxDropOptions& options);

// "kytctl: TEXT" on standard error, with control characters escaped; returns 1.
int failed(const Error& error);
int failed(const std::string& text);
// The same, of a question to the running daemon; returns 3 where it does not run.
int failedAtWindow(const Error& error);

}  // namespace kyt::tools
