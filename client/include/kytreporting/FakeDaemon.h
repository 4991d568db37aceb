// libkytreporting-testing: a daemon in the test of a program that reports. It listens on a socket of its own, speaks what
// the real one speaks, and keeps what it was told: no entitlement, no storebag, no network. Nothing leaves it. A session
// that aggregates gets its own messages and those of the sessions beneath it in its hierarchy, as from the real one, but no
// starts and ends of sessions. It answers as the real one does where all is well: client types 0 to 4 have no storebag, a
// session has no back ends before it is configured, only what is batched can be flushed, and only the back end "uploadserver"
// takes files and log data. It knows no entries of storebags: consent, promised user information, lists, sampling, filters
// and servers' answers are for the real one (kytdemo --stage).
//
//   kyt::testing::FakeDaemon daemon;                      // or with Options
//   ASSERT_EQ(daemon.start(), std::nullopt);
//   setenv("KYTREPORTING_SOCKET", daemon.socketPath().c_str(), 1);
//   runWhatIsTested();
//   ASSERT_TRUE(daemon.waitFor(kyt::testing::Kind::message, 1));
//   EXPECT_EQ(daemon.events(kyt::testing::Kind::message)[0].payload.integer("step"), 1);
//
// Threads: one thread owns it (start, stop, destruction); everything else may be called from any thread. Options::onEvent
// runs on threads of its own, for one connection at a time in order, and must not block or call stop().
// Errors: values. It makes a few threads and a socket; both are gone when stop() has returned.
//
// Link with pkg-config kytreporting-testing.
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/base/Error.h"
#include "platform/base/Function.h"
#include "platform/objects/Value.h"

namespace kyt::testing {

enum class Kind : uint8_t {
  session,        // a program said who it is: sessionInfo, userInfo
  configuration,  // it asked to be configured
  states,         // it asked for its live back ends, with new user information or none
  message,        // category, type, flag, payload; of a single message sessionInfo and userInfo too
  flush,
  sharedData,  // payload: the entries; null values are removed keys
  digestKey,   // text: the key in hexadecimal digits
  file,        // text: the file's URL
  logData,     // payload: one entry "logData", the array
  finish,      // the session's graceful end
  end,         // its connection is over, in order or not
};
// "session", "configuration" and so on; never null.
[[nodiscard]] const char* nameOf(Kind kind);

struct Event {
  Kind kind = Kind::end;
  uint64_t connection = 0;  // from 1, in the order of coming
  uint16_t category = 0, type = 0;
  uint32_t flag = 0;        // 0 to 3
  bool single = false;      // a message without a session
  bool aggregates = false;  // of a session: it wants its descendants' messages
  bool dropped = false;     // a message that the real one drops: not configured, or no storebag
  Dictionary sessionInfo;
  std::optional<Dictionary> userInfo;
  Dictionary payload;
  std::string text;

  // The same as one object, with the keys "event", "connection" and those of the kind: what `kytctl listen` prints.
  [[nodiscard]] Dictionary dictionary() const;
};

class FakeDaemon {
 public:
  struct Options {
    std::string socketPath;  // empty: in a new folder, removed at the end
    std::vector<std::string> live = {
        "httppost"};       // the back ends that a configuration brings; none: all are off
    bool storebag = true;  // false: there is none for any client type, configurations bring nothing
    bool refuse = false;   // every connection is refused, as of a program without a grant
    // After so many messages it ends as one that was killed: connections break, answers stay away. 0: never.
    uint64_t dieAfter = 0;
    Function<void(const Event&)> onEvent;  // told of each; may be empty
  };

  FakeDaemon();
  explicit FakeDaemon(Options options);
  ~FakeDaemon();  // stops
  FakeDaemon(const FakeDaemon&) = delete;
  FakeDaemon& operator=(const FakeDaemon&) = delete;

  // Takes connections; again after stop() or a death. None, or why not: the path is too long, or somebody listens there.
  [[nodiscard]] std::optional<Error> start();
  // Ends every connection, and removes the socket. What was told stays.
  void stop();
  [[nodiscard]] const std::string& socketPath() const;
  // It was started, and has neither been stopped nor died.
  [[nodiscard]] bool isRunning() const;

  // Everything so far, or all of one kind; in the order of coming, over all connections and starts.
  [[nodiscard]] std::vector<Event> events() const;
  [[nodiscard]] std::vector<Event> events(Kind kind) const;
  // Whether that many of a kind come, or have come, within `timeout` of real time.
  [[nodiscard]] bool waitFor(Kind kind, size_t count,
                             std::chrono::milliseconds timeout = std::chrono::seconds(10)) const;

 private:
  class Implementation;
  const std::unique_ptr<Implementation> implementation_;
};

}  // namespace kyt::testing
