// One session of the client library: the queue that the program's threads fill, and the connection that the
// library's thread keeps for it. What must survive the daemon's death (KeptState) is replayed on each new connection.
//
// Threads: the operations under "any thread" only touch the queue, the figures and atomics; everything
// else belongs to the library's thread (Loop).
#pragma once

#include <atomic>
#include <chrono>
#include <deque>
#include <memory>
#include <optional>
#include <string>

#include "client/Aggregation.h"
#include "client/Command.h"
#include "client/Connection.h"
#include "client/Figures.h"
#include "client/KeptState.h"
#include "client/LibraryThread.h"
#include "client/OutgoingQueue.h"
#include "client/Output.h"
#include "client/Standing.h"
#include "client/Unanswered.h"
#include "client/Waiters.h"

namespace kyt {
struct Message;
}

namespace kyt::client {

class Loop;

class Session {
 public:
  Session(KYTReporting::Options options, Loop* loop, bool single, const KYTReporting::Behaviour& behaviour);
  ~Session();
  Session(const Session&) = delete;
  Session& operator=(const Session&) = delete;

  // Any thread.
  bool enqueueMessage(uint32_t category, uint32_t type, Dictionary&& payload, uint32_t flag);
  void enqueueCommand(std::unique_ptr<Command> command);
  // Whether it takes nothing any more, and why.
  [[nodiscard]] bool refuses() const {
    return inert_.load(std::memory_order_relaxed) || closed_.load(std::memory_order_relaxed) ||
           saidGoodbye_.load(std::memory_order_relaxed);
  }
  [[nodiscard]] Error refusal() const;
  [[nodiscard]] KYTReporting::Statistics statistics() const;
  [[nodiscard]] KYTReporting::State state() const { return standing_.state(); }
  [[nodiscard]] std::string stateReason() const;
  // Says goodbye and waits; whether the daemon has taken everything. On the library's thread it does not
  // wait.
  bool finishAndWait(std::chrono::milliseconds timeout);
  // Nothing runs for this session any more once it has returned (on the library's thread: once the running
  // completion has). Safe to call twice.
  void close();
  // The same for who does not own it: any number of threads, beside close().
  void stop();

  // In a child process just forked.
  void becomeInert();
  // There is no thread for it: the thread that opens it says so and ends it.
  void endUnserved();
  // A message whose numbers are out of range.
  void countInvalid() { figures_.droppedInvalid.add(); }

  // The library's thread: moves everything that can be moved now; whether anything was. False from isDone()
  // on.
  bool pump(SteadyTime now) REQUIRES(libraryThread);
  void readable(SteadyTime now) REQUIRES(libraryThread);
  [[nodiscard]] bool hasWork() const REQUIRES(libraryThread);
  [[nodiscard]] bool isDone() const REQUIRES(libraryThread) { return done_; }
  [[nodiscard]] int fd() const REQUIRES(libraryThread) { return connection_.fd(); }
  [[nodiscard]] bool wantsToWrite() const REQUIRES(libraryThread) { return output_.waiting() > 0; }
  // When pump() has something to do without being told, or none.
  [[nodiscard]] std::optional<SteadyTime> nextDeadline() const REQUIRES(libraryThread);
  void end(ClientError code, const std::string& reason) REQUIRES(libraryThread);  // every completion runs

 private:
  struct Failing {
    Answer answer;
    ClientError code;
    std::string reason;
  };

  void countRefusal();
  [[nodiscard]] bool ensureConnected(SteadyTime now) REQUIRES(libraryThread);
  void connect(SteadyTime now) REQUIRES(libraryThread);
  bool move(SteadyTime now) REQUIRES(libraryThread);
  void disconnected(SteadyTime now, std::string reason) REQUIRES(libraryThread);
  [[nodiscard]] bool givesUp() const REQUIRES(libraryThread);
  [[nodiscard]] std::vector<Answer> emptyQueue() REQUIRES(libraryThread);
  void failAll(std::vector<Answer> answers, ClientError code, const std::string& reason)
      REQUIRES(libraryThread);
  void expire(SteadyTime now) REQUIRES(libraryThread);
  bool drain() REQUIRES(libraryThread);
  void drainMessage(const MessageArguments& message) REQUIRES(libraryThread);
  void drainCommand(std::unique_ptr<Command> command) REQUIRES(libraryThread);
  bool write(SteadyTime now) REQUIRES(libraryThread);
  void pingIfDue(SteadyTime now) REQUIRES(libraryThread);
  void wrote() REQUIRES(libraryThread);
  void flushIfDue(SteadyTime now) REQUIRES(libraryThread);
  void greet() REQUIRES(libraryThread);
  [[nodiscard]] const char* readMessages() REQUIRES(libraryThread);
  void handle(const Message& message) REQUIRES(libraryThread);
  void handleReply(const Message& message) REQUIRES(libraryThread);
  void complete(Command& command, const Message& message) REQUIRES(libraryThread);
  void learnStates(const StateNames& names) REQUIRES(libraryThread);

  // To a daemon that does not know the session yet.
  void tellAgain() REQUIRES(libraryThread);
  bool sendAgain(Call call) REQUIRES(libraryThread);

  // Constant.
  const std::string problem_;  // of the session's information: nothing is sent
  const bool single_;
  const std::chrono::milliseconds callDeadline_;
  const bool finishWaitsForDaemon_, waitForDaemon_;
  const std::chrono::milliseconds flushInterval_;  // 0: never by itself
  Loop* const loop_;

  // Any thread.
  OutgoingQueue queue_;
  Figures figures_;
  std::atomic<bool> closed_{false}, inert_{false}, connected_{false}, saidGoodbye_{false};
  std::atomic<bool> unserved_{
      false};  // there was no thread for it, or no daemon, and it does not wait for one
  Standing standing_;
  Waiters waiters_;

  // The library's thread.
  KeptState kept_ GUARDED_BY(libraryThread);
  Aggregation aggregation_ GUARDED_BY(libraryThread);
  Connection connection_ GUARDED_BY(libraryThread);
  Output output_ GUARDED_BY(libraryThread);
  Unanswered unanswered_ GUARDED_BY(libraryThread);
  std::deque<Failing> failing_ GUARDED_BY(libraryThread);  // whose completions run now
  bool ending_ GUARDED_BY(libraryThread) = false;          // the goodbye is said: nothing goes after it
  bool triedAtGoodbye_ GUARDED_BY(libraryThread) = false;  // the last attempt before giving up
  bool done_ GUARDED_BY(libraryThread) = false;
  SteadyTime nextFlush_ GUARDED_BY(libraryThread) = SteadyTime::max();  // of what was written since the last
};

}  // namespace kyt::client
