// A session as the daemon would serve it, played through by the daemon's own agent, session and back ends, in this process
// and without effect: the clock stands still, what is posted goes nowhere and is kept, nothing is stored. So whatever is
// told of an event here is what the daemon does with it, and no rule is written twice.
//
// Not rehearsed: other sessions (a hierarchy), and what servers answer, who take everything here. One thread.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "config/Environment.h"
#include "platform/URLSession.h"
#include "platform/base/Books.h"
#include "platform/base/Clock.h"
#include "platform/base/Counters.h"
#include "platform/base/Limits.h"
#include "platform/base/Settings.h"
#include "platform/fake/FakeURLSession.h"
#include "platform/objects/Value.h"

namespace kyt {
class Bundle;
class Cryptography;
class Deflate;
class DeviceProperties;
class DiagnosticsConsent;
class JSON;
class MemoryInfo;
class PropertyLists;
class UserDefaults;
}  // namespace kyt

namespace kyt::tools {

// What a rehearsal asks of a device, real or made up. All of it outlives the rehearsal.
struct RehearsedDevice {
  UserDefaults& userDefaults;  // only read
  DeviceProperties& deviceProperties;
  DiagnosticsConsent& consent;
  Cryptography& cryptography;
  PropertyLists& propertyLists;
  JSON& json;
  Deflate& deflate;
  MemoryInfo& memory;
  Bundle& clientBundle;
  Bundle& daemonBundle;
  StorebagHosts hosts;
  Limits limits;
  StorebagRefusals refusals;
  TimeValue now;
};

// What the program says of itself.
struct RehearsedProgram {
  Dictionary sessionInfo;
  std::optional<Dictionary> userInfo;
  uint32_t user = 0;
  bool single = false;  // its events are single messages, without a session
};

// One rule as it was applied; see RuleWitness.
struct JudgedRule {
  std::string backend, rule;
  bool passes = false;
  Value value, wanted;
};

// What the session came to by being configured.
struct SessionOutcome {
  bool hasStorebag = false;
  std::string storebagVersion;
  std::vector<std::string> backends;  // that were made
  std::vector<std::string> live;      // of these, as the program is told
  std::vector<Reason> reasons;        // for which what follows is dropped
  std::vector<std::string> lines;     // of the log, from the default level on
};

// A record before the filters, after them, and whether the back end's lists let it pass.
struct FilteredRecord {
  std::string backend;
  Dictionary before, after;
};

struct KeptPost {
  URLRequest request;
  Dictionary message;  // the body, decompressed and parsed; only this event's records are in it
};

struct EventOutcome {
  std::vector<KeptPost> posts;
  bool atOnce = false;  // the posts; otherwise with the next flush
  bool isNewDevice =
      false;  // they have an identifier that the device has not stored yet: the daemon makes another
  size_t datagrams = 0;        // to the dashboard
  size_t handedToAdaptor = 0;  // of the diagnostics service
  std::vector<FilteredRecord> records;
  std::vector<Reason> reasons;
  std::vector<std::string> lines;
  [[nodiscard]] bool leaves() const;
};

// All of a session, from its start to its end.
struct WholeSession {
  std::vector<BookRow> rows;  // of the program's events, by back end; all is delivered or dropped
  size_t posts = 0;
  uint64_t bytes = 0;  // of their requests: lines, headers and bodies
};

class Rehearsal {
 public:
  // Answers the storebag's request. Called while the session is configured; may block.
  using StorebagServer = FakeURLSessionFactory::Responder;

  // `draw`: the session's sampling draw, 0 to 100 hundredths.
  Rehearsal(const RehearsedDevice& device, StorebagServer server, RehearsedProgram program, uint32_t draw);
  ~Rehearsal();
  Rehearsal(const Rehearsal&) = delete;
  Rehearsal& operator=(const Rehearsal&) = delete;

  // First, and once. A program of single messages has nothing to configure; its outcome comes with its events.
  SessionOutcome configure();
  // `message`: as it goes over the wire (Category, Type, Payload, Flag). What it left in a batch is flushed.
  EventOutcome send(const Dictionary& message);
  // Instead of the two: configures, sends, ends. An empty message stands for a flush.
  WholeSession runWhole(const std::vector<Dictionary>& messages);
  // So far, in order; of single messages each makes its own.
  [[nodiscard]] const std::vector<JudgedRule>& rules() const;

 private:
  struct Parts;
  const std::unique_ptr<Parts> parts_;
};

}  // namespace kyt::tools
