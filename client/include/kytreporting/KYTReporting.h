// libkytreporting: reporting events to kytreportingd from C++.
//
// One KYTReporting object is one reporting session: it describes its program to the daemon, and then sends
// messages, each a category, a type, an optional flag and a payload. Nothing here ever blocks the caller on
// the daemon or the network: calls put work into a bounded queue, and one thread of the library
// ("kytreporting", started with the first session, shared by all) talks to the daemon. What does not fit is
// dropped and counted in `statistics()`; nothing is lost silently.
//
// The daemon may not run yet, may die, may return: the library connects again, after a tenth of a second at first
// and five seconds at the latest, and tells it again who the session is: its information and user information, that
// it was configured, its shared data and its digest key, as far as they could be sent before. What is still queued
// then waits for the next daemon; what was written and not acknowledged is counted as lost. state() and
// Options::onStateChange say where the session stands. With KYTREPORTING_DEBUG=1 in the environment (not of
// set-user-ID programs) every change of the state and every drop is a line on standard error.
//
// Threads: every operation may be called from any thread. Completions and the blocks of Options run on the library's
// thread, one at a time; they must not block, and may call anything here. A call that fails at once (the session
// is closed or its information wrong, no room, a file that cannot be opened, a number out of range) runs its
// completion before it returns, on the caller's thread.
// A completion runs exactly once: with the daemon's answer, or with an error when the connection ends after the call
// was written, when no daemon took it within Options::callDeadline, or when the session closes first.
// Ownership: arguments are copied (objects share their contents, copying costs a pointer).
// Errors: values; nothing throws but std::bad_alloc.
// Fork: in a child process made by fork() the sessions of the parent are inert: sending returns false.
// Exit: a process may end at any time; `finish()` first, if what is queued matters.
//
// Link with -lkytreporting (pkg-config kytreporting; CMake kytreporting::kytreporting).
#pragma once

#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/base/Error.h"
#include "platform/base/Function.h"
#include "platform/objects/Keys.h"
#include "platform/objects/Value.h"

#if defined(__GNUC__)
#define KYT_EXPORT __attribute__((visibility("default")))
#else
#define KYT_EXPORT
#endif

namespace kyt {

namespace client {
struct Command;
}

// The domain of errors that the library itself gives, and their codes.
inline constexpr char kKYTReportingClientErrorDomain[] = "KYTReportingClientErrorDomain";
enum class ClientError : int32_t {
  // The connection ended before the answer, or there is no daemon (the description says why).
  notConnected = 1,
  closed = 2,     // the session was closed, or belongs to the parent of this process
  queueFull = 3,  // the bounded queue had no room
  refused = 4,    // the daemon answered with an error (the description has its text)
  invalid = 5,    // the arguments cannot be meant or sent so (the description names what)
  timedOut = 6,   // no daemon took the call within Options::callDeadline
};

// A session's information, typed: what a misspelt key or a value of another type cannot happen to.
struct SessionInfo {
  uint32_t sessionID = 0;      // the program's own number for the session; log lines show it
  uint8_t clientType = 0;      // 0 to 23: which kind of client; 5 to 23 have a storebag
  uint16_t clientVersion = 0;  // goes with every record
  bool batchEvent = false;     // collect events until a flush, a threshold or the session's end
  // The program gives user information. Then the owner's consent, and locale, device, filter and sampling
  // rules apply. False is for what says nothing about anyone.
  bool requireUserInfo = true;
  struct HierarchyToken {
    std::string tokenID;  // the same for all sessions of the hierarchy: 128 random bits as text
    uint32_t level = 0;   // 0 is the top
  };
  std::optional<HierarchyToken> hierarchyToken = std::nullopt;

  [[nodiscard]] Dictionary dictionary() const;
  // What Options::sessionInfo takes.
  operator Dictionary() const { return dictionary(); }  // NOLINT(google-explicit-constructor)
};

// A message that this session receives for itself and its descendants, when it aggregates. The last one, when
// the daemon ends the aggregation, has no session information, no payload, and zeros.
struct AggregatedMessage {
  std::optional<Dictionary> sessionInfo;
  double timestamp = 0;  // seconds since 1970
  uint16_t category = 0;
  uint16_t type = 0;
  std::optional<Dictionary> payload;
};

class KYT_EXPORT KYTReporting {
 public:
  // How far the session's messages get, as far as the library can know.
  enum class State : uint8_t {
    noDaemon = 0,       // no connection: no socket, nobody listens, or the connection ended
    refused = 1,        // the daemon does not serve this program, or the session's information is wrong
    connected = 2,      // connected, and not configured yet: the daemon drops what is sent
    noStorebag = 3,     // configured; no storebag, or one without back ends: the daemon drops all
    noLiveBackEnd = 4,  // configured, and no back end takes events
    live = 5,           // at least one back end takes events (filters and sampling may still leave some out)
  };
  // "no-daemon", "refused", "connected", "no-storebag", "no-live-back-end", "live"; "" for what is no state.
  [[nodiscard]] static const char* nameOf(State state);

  struct Options {
    // The daemon's socket. Empty: the environment's KYTREPORTING_SOCKET, or
    // /run/kytreportingd/com.vantu.kytreportingd.
    std::string socketPath;
    // A SessionInfo, or a dictionary with the keys kKYTReportingSessionInfo…: SessionID (32 bits), ClientType
    // (0 to 23), ClientVersion (16 bits), BatchEvent, RequireUserInfo (booleans, or 0 and 1), HierarchyToken
    // (a dictionary: TokenID, text; Level, 32 bits). Each may be absent. See checkSessionInfo().
    Dictionary sessionInfo;
    std::optional<Dictionary> userInfo;  // kKYTReportingUserInfo… and whatever else every event shall carry
    Value frameworksToCheck;
    // Given: the session aggregates.
    Function<void(const AggregatedMessage&)> aggregationBlock;
    // Bounds of the queue towards the daemon: messages (64 to 65536) and the bytes of their encoded form.
    size_t maxQueuedMessages = 4096;
    size_t maxQueuedBytes = 4u << 20;
    // Told, on the library's thread, when the state or its reason changes; the reason is a text for people that
    // names what the library knows: the path and the system's error, the client type, the names that no entry
    // has. Not told of the end that the program itself asks for, nor for single messages.
    Function<void(State state, const std::string& why)> onStateChange;
    // How long the completion of a call waits for a daemon that is not there; then it gets an error of the code
    // timedOut. startConfiguration, fetchStates, shared data and the digest key still reach a daemon that comes
    // later; messages with a reply, flushes and uploads do not. Zero or less: as long as the session lives. An
    // answer of a daemon that has taken the call is waited for without a limit.
    std::chrono::milliseconds callDeadline = std::chrono::seconds(30);
    // Whether finish() waits, with what is queued, for a daemon that never took anything of this session. If
    // not, it tries once more to connect and gives up, so that programs end at once where there is no daemon.
    bool finishWaitsForDaemon = false;
  };

  // Where a session's messages are, and what else happened to it. A message is what sendMessage(), in both forms, and
  // sendSingleMessage() are given; flushes, uploads and other calls are none. Always, unless something is in motion:
  //   accepted = sent + queued + lostOnConnectionEnd + lostInQueue + droppedUnsendable + droppedTooLate
  // and what was refused (droppedQueueFull, droppedClosed, droppedInvalid) was not accepted: each is counted once.
  struct Statistics {
    // Messages written to the daemon's socket, and not lost with their connection: taken by the daemon, or about to be.
    // Becomes less by what lostOnConnectionEnd becomes more.
    uint64_t sent = 0;
    uint64_t droppedQueueFull = 0;  // refused by sendMessage because the queue was full
    // Written, but their connection ended before the daemon is known to have taken them: it took between none and all.
    // What one end loses is bounded: kMostUnacknowledged messages, and those whose completion then gets an error.
    uint64_t lostOnConnectionEnd = 0;
    uint64_t droppedClosed = 0;  // refused: sent after close, or in a child process
    uint64_t droppedInvalid =
        0;  // refused: numbers out of range, or their session's information is wrong; and calls
            // that are no messages and could not be encoded
    uint64_t connections = 0;  // connections made, the first included
    uint64_t queued = 0;       // messages in the queue now
    uint64_t waitedTooLong =
        0;  // calls, messages or not, whose completion waited for a daemon until the deadline
    uint64_t replayFailed = 0;       // values that a daemon that came back could not be told again
    uint64_t sentUnconfigured = 0;   // sent before startConfiguration: the daemon dropped them
    uint64_t accepted = 0;           // messages that were not refused
    uint64_t lostInQueue = 0;        // still in the queue when the session ended
    uint64_t droppedUnsendable = 0;  // larger than a megabyte, or nested too deeply
    uint64_t droppedTooLate = 0;     // no daemon took them within Options::callDeadline
  };
  // The library has at most so many messages without a completion under way that the daemon has not acknowledged.
  static constexpr uint64_t kMostUnacknowledged = 16384;

  // What is wrong with a session's information: a key that there is not, or a value of another type or out of
  // range. The description names the key; none when all is right. The daemon would take such an entry as
  // absent, so a session with one sends nothing: sendMessage() returns false, and completions get this error.
  [[nodiscard]] static std::optional<Error> checkSessionInfo(const Dictionary& sessionInfo);

  // What a session does by itself; given beside the options, which programs in the field have compiled in.
  struct Behaviour {
    // Every so often, if anything was sent since the last flush, the session flushes: the longest that an event is batched.
    // 0: never.
    std::chrono::milliseconds flushInterval{0};
    // The destructor calls finish() with this time. 0: it closes without waiting.
    std::chrono::milliseconds finishOnDestruction{0};
    // If not, a session that finds nobody, or is refused, when it first tries to connect has ended: its messages are lost
    // and counted, completions get the code notConnected, sendMessage() returns false. One that a daemon has taken waits
    // for the next as any other.
    bool waitForDaemon = true;
  };

  // Never blocks and never fails: a daemon that does not run yet is waited for. Where the system gives the library no
  // thread, the session has ended when this returns: completions get the code notConnected, stateReason() says so.
  [[nodiscard]] static std::unique_ptr<KYTReporting> open(Options options);
  [[nodiscard]] static std::unique_ptr<KYTReporting> open(Options options, const Behaviour& behaviour);
  // Closes without waiting: what was queued and not written is counted as lost. finish() first to keep it, or let
  // Behaviour::finishOnDestruction do so.
  ~KYTReporting();
  KYTReporting(const KYTReporting&) = delete;
  KYTReporting& operator=(const KYTReporting&) = delete;

  using StatesCompletion = Function<void(std::optional<std::vector<std::string>>, std::optional<Error>)>;
  using ObjectCompletion = Function<void(Value, std::optional<Error>)>;
  using TextCompletion = Function<void(std::string, std::optional<Error>)>;
  using SuccessCompletion = Function<void(bool, std::optional<Error>)>;

  // Asks the daemon to configure the session from its storebag. The completion gets the names of the live
  // back ends; none (and no error) without a storebag, or with one that names no back end. May be empty.
  void startConfiguration(StatesCompletion completion = nullptr);
  // New user information; none: as it was where RequireUserInfo is set, else none from now on.
  void fetchStates(std::optional<Dictionary> userInfo, StatesCompletion completion = nullptr);
  void fetchDisplayURL(TextCompletion completion);

  // Queues one message; whether it was taken. Category and type are 0 to 65535; other numbers are refused, and
  // counted in droppedInvalid. Category 0 is the daemon's own: its type 0 is a session's start, type 1 its end. No system call, no wait for a lock (a sleeping library thread
  // is woken by the first message after a pause). Flags: 1 realtime, 2 expedite, 3 both, anything else
  // neither.
  bool sendMessage(uint32_t category, uint32_t type, Dictionary payload, uint32_t flag = 0);
  // The same, and returns why the message was not taken; none: it was.
  [[nodiscard]] std::optional<Error> trySendMessage(uint32_t category, uint32_t type, Dictionary payload,
                                                    uint32_t flag = 0);
  // The same with the daemon's answer: the text of what was posted, or none.
  void sendMessage(uint32_t category, uint32_t type, Dictionary payload, uint32_t flag,
                   ObjectCompletion completion);
  // Everything queued before it is sent first; the completion gets the result or the first back end's error.
  void flush(ObjectCompletion completion = nullptr);

  void updateSharedData(Dictionary entries);
  void updateSharedData(String key, Value value);  // null removes the key
  // Key for the digests of the "qrs" back end's posts; algorithm 0 is HMAC-SHA1.
  void setDigestKey(Data key, int32_t algorithm);

  // Asks for uploads; the answer is whether a back end took it. The file is opened here, with the caller's
  // rights.
  void uploadFile(const std::string& path, SuccessCompletion completion = nullptr);
  void uploadLogData(Array logData, SuccessCompletion completion = nullptr);

  // Says goodbye: what is queued is sent, the session is marked as finished gracefully and closed. Waits for
  // that at most `timeout` of real time; whether all was sent. Gives up at once when no daemon ever took anything
  // and none is there (see Options::finishWaitsForDaemon); stateReason() then says why. Called from a completion
  // it does not wait, and returns false.
  bool finish(std::chrono::milliseconds timeout = std::chrono::seconds(5));

  // Closes without waiting, as the destructor does; the object stays, and takes nothing any more. Any number of threads.
  void close();
  // Closes all sessions and single messages of this process; the objects stay, and are closed ones. No completion runs on
  // the library's thread once it has returned, unless a session is opened later.
  static void closeAll();

  [[nodiscard]] Statistics statistics() const;
  // The sums over all sessions of this process, ended ones and single messages included; `queued` is of those that live.
  // Any thread; visits every living session under a lock that opening and closing a session take too, messages do not. In a
  // child made by fork() they begin at zero, and the parent's sessions do not count.
  [[nodiscard]] static Statistics totalStatistics();
  // Where the session stands now, and why. After its end: where it stood. In a child process made by fork() the
  // state is the parent's of that moment.
  [[nodiscard]] State state() const;
  [[nodiscard]] std::string stateReason() const;

  // One event without a session of its own: the completion gets "finished", or what went wrong.
  static void sendSingleMessage(Options options, uint32_t category, uint32_t type,
                                std::optional<Dictionary> payload, TextCompletion completion);

 private:
  class Implementation;
  explicit KYTReporting(std::shared_ptr<Implementation> implementation);
  void enqueue(std::unique_ptr<client::Command> command);
  std::shared_ptr<Implementation> implementation_;  // shared with the library's thread
};

}  // namespace kyt
