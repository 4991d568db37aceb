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
  Session(KYTReporting::Options options, Loop* loop, bool single);
  ~Session();
  Session(const Session&) = delete;
  Session& operator=(const Session&) = delete;

  // Any thread.
  bool enqueueMessage(uint32_t category, uint32_t type, Dictionary&& payload, uint32_t flag);
  void enqueueCommand(std::unique_ptr<Command> command);
  [[nodiscard]] KYTReporting::Statistics statistics() const;
  [[nodiscard]] KYTReporting::State state() const { return standing_.state(); }
  [[nodiscard]] std::string stateReason() const;
  // Says goodbye and waits; whether the daemon has taken everything. On the library's thread it does not
  // wait.
  bool finishAndWait(std::chrono::milliseconds timeout);
  // Nothing runs for this session any more once it has returned (on the library's thread: once the running
  // completion has). Safe to call twice.
  void close();

  // In a child process just forked.
  void becomeInert();
  // There is no thread for it: the thread that opens it says so and ends it.
  void endUnserved();

  // The library's thread: moves everything that can be moved now; whether anything was. False from isDone()
  // on.
  bool pump(SteadyTime now);
  void readable(SteadyTime now);
  [[nodiscard]] bool hasWork() const;
  [[nodiscard]] bool isDone() const { return done_; }
  [[nodiscard]] int fd() const { return connection_.fd(); }
  [[nodiscard]] bool wantsToWrite() const { return output_.waiting() > 0; }
  // When pump() has something to do without being told, or none.
  [[nodiscard]] std::optional<SteadyTime> nextDeadline() const;
  void end(ClientError code, const std::string& reason);  // every completion runs

 private:
  struct Failing {
    Answer answer;
    ClientError code;
    std::string reason;
  };

  [[nodiscard]] bool refuses() const {
    return inert_.load(std::memory_order_relaxed) || closed_.load(std::memory_order_relaxed) ||
           saidGoodbye_.load(std::memory_order_relaxed);
  }
  [[nodiscard]] Error refusal() const;
  [[nodiscard]] bool ensureConnected(SteadyTime now);
  void connect(SteadyTime now);
  bool move(SteadyTime now);
  void disconnected(SteadyTime now, std::string reason);
  [[nodiscard]] bool givesUp() const;
  void failAll(std::vector<Answer> answers, ClientError code, const std::string& reason);
  void expire(SteadyTime now);
  bool drain();
  void drainMessage(const MessageArguments& message);
  void drainCommand(std::unique_ptr<Command> command);
  bool write(SteadyTime now);
  void pingIfDue(SteadyTime now);
  void greet();
  [[nodiscard]] const char* readMessages();
  void handle(const Message& message);
  void handleReply(const Message& message);
  void complete(Command& command, const Message& message);
  void learnStates(const StateNames& names);

  // To a daemon that does not know the session yet.
  void tellAgain();
  bool sendAgain(Call call);

  // Constant.
  const std::string problem_;  // of the session's information: nothing is sent
  const bool single_;
  const std::chrono::milliseconds callDeadline_;
  const bool finishWaitsForDaemon_;
  Loop* const loop_;

  // Any thread.
  OutgoingQueue queue_;
  Figures figures_;
  std::atomic<bool> closed_{false}, inert_{false}, connected_{false}, saidGoodbye_{false};
  std::atomic<bool> unserved_{false};  // there was no thread for it
  Standing standing_;
  Waiters waiters_;

  // The library's thread.
  KeptState kept_;
  Aggregation aggregation_;
  Connection connection_;
  Output output_;
  Unanswered unanswered_;
  std::deque<Failing> failing_;  // whose completions run now
  bool ending_ = false;          // the goodbye is said: nothing goes after it
  bool triedAtGoodbye_ = false;  // the last attempt before giving up
  bool done_ = false;
};

}  // namespace kyt::client
