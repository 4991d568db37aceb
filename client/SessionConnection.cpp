// A session's connection: the library's thread alone.
#include <algorithm>
#include <utility>

#include "client/Replay.h"
#include "client/Session.h"
#include "platform/ipc/MessageReader.h"

namespace kyt::client {

namespace {

using State = KYTReporting::State;

// Encoded bytes waiting for the socket: what a broken connection can lose.
constexpr size_t kWriteAhead = 64 * 1024;

const char* reasonOfConnected(bool configured) {
  return configured ? "the configuration is on its way" : "startConfiguration was not called yet";
}

}  // namespace

bool Session::hasWork() const {
  return closed_.load() || queue_.hasNewCommand() || (connection_.isTaken() && !queue_.isEmpty());
}

std::optional<SteadyTime> Session::nextDeadline() const {
  if (connection_.isTaken()) {
    const SteadyTime due = std::min(unanswered_.nextPing().value_or(SteadyTime::max()), nextFlush_);
    return due == SteadyTime::max() ? std::nullopt : std::optional(due);
  }
  const SteadyTime next = connection_.isOpen() ? queue_.nextDeadline()
                                               : std::min(queue_.nextDeadline(), connection_.nextAttempt());
  if (next == SteadyTime::max()) return std::nullopt;
  return next;
}

bool Session::pump(SteadyTime now) {
  if (done_) return false;
  if (closed_) {
    end(problem_.empty() ? ClientError::closed : ClientError::invalid,
        problem_.empty() ? "the session was closed" : problem_);
    return false;
  }
  expire(now);
  const bool moved = ensureConnected(now) && move(now);
  if (done_) return moved;
  if (standing_.debugs()) standing_.sayDrops(statistics());
  standing_.announce();
  return moved;
}

bool Session::ensureConnected(SteadyTime now) {
  if (done_) return false;
  if (connection_.isOpen()) return true;
  if (saidGoodbye_ && !std::exchange(triedAtGoodbye_, true)) connection_.setNextAttempt(now);
  if (now >= connection_.nextAttempt()) connect(now);
  if (!done_ && givesUp()) {
    unserved_ = !waitForDaemon_;
    end(ClientError::notConnected, standing_.why());
  }
  return !done_ && connection_.isOpen();
}

// Nothing was ever taken, and nobody is there to take anything: a program that ends need not wait.
bool Session::givesUp() const {
  if (!connection_.foundNobody() || connection_.wasEverTaken() || connection_.isOpen()) return false;
  return !waitForDaemon_ || (saidGoodbye_ && triedAtGoodbye_ && !finishWaitsForDaemon_);
}

bool Session::move(SteadyTime now) {
  bool moved = false;
  for (;;) {
    const bool drained = connection_.isTaken() && !ending_ && drain();
    if (connection_.isTaken()) flushIfDue(now);
    if (connection_.isTaken()) pingIfDue(now);
    const bool written = wantsToWrite() && write(now);
    moved |= drained || written;
    if (!drained || wantsToWrite() || !connection_.isOpen()) return moved;
  }
}

void Session::connect(SteadyTime now) {
  std::string problem;
  if (!connection_.open(now, problem)) {
    standing_.become(State::noDaemon, problem);
    if (single_ && connection_.foundNobody()) end(ClientError::notConnected, problem);
    return;
  }
  figures_.connections.add();
  output_.restart(Connection::opening());
  if (standing_.state() == State::noDaemon)
    standing_.note(State::noDaemon, connection_.path() + ": the daemon has not answered yet");
}

void Session::disconnected(SteadyTime now, std::string reason) {
  if (done_) return;
  const Connection::End ended = connection_.end(now, reason);
  standing_.become(ended.refused ? State::refused : State::noDaemon, reason);
  connected_ = false;
  queue_.lookAgain();  // deadlines count again
  nextFlush_ = SteadyTime::max();
  output_.restart();
  Unanswered::Left left = unanswered_.takeAll();
  figures_.lostOnConnectionEnd.add(left.messages);
  failAll(std::move(left.answers), ClientError::notConnected, reason);
  if (ending_ || (single_ && (ended.taken || ended.refused))) end(ClientError::notConnected, reason);
}

bool Session::drain() {
  bool any = false;
  OutgoingQueue::Item item;
  while (output_.waiting() < kWriteAhead && unanswered_.messages() < KYTReporting::kMostUnacknowledged &&
         !ending_ && queue_.pop(item)) {
    any = true;
    if (item.command)
      drainCommand(std::move(item.command));
    else
      drainMessage(item.message);
  }
  return any;
}

void Session::drainMessage(const MessageArguments& message) {
  const std::optional<uint32_t> serial = output_.message(message);
  if (!serial) {
    standing_.say("message of category " + std::to_string(message.category) + ", type " +
                  std::to_string(message.type) + ": larger than a megabyte, or nested too deeply");
    figures_.droppedUnsendable.add();
    return;
  }
  figures_.written.add();
  wrote();
  if (!kept_.isConfigured() && figures_.sentUnconfigured.add() == 0)
    standing_.become(State::connected,
                     "messages are sent, and startConfiguration was not called: the daemon drops them");
  unanswered_.addMessage(*serial);
}

void Session::drainCommand(std::unique_ptr<Command> command) {
  if (!command->given) return;
  Call& call = command->call;
  if (call.method == Method::finishSessionGracefully) ending_ = true;
  const std::optional<uint32_t> serial = output_.call(call, connection_.passesDescriptors());
  if (!serial) {
    (command->isMessage() ? figures_.droppedUnsendable : figures_.droppedInvalid).add();
    call.answer.fail(ClientError::invalid, "the arguments cannot be sent: too large, or nested too deeply");
    return;
  }
  if (command->isMessage()) {
    figures_.written.add();
    wrote();
  }
  if (call.method == Method::flushMessagesWithCompletion) nextFlush_ = SteadyTime::max();
  kept_.takeOver(call);
  if (call.method == Method::startConfigWithCompletionHandler && standing_.state() == State::connected)
    standing_.note(State::connected, reasonOfConnected(true));
  unanswered_.addCall(*serial, std::move(command));
}

bool Session::write(SteadyTime now) {
  const Output::Written written = output_.writeTo(connection_.socket());
  if (written.ended) {
    readable(now);  // what the daemon said before it ended the connection
    if (!done_ && connection_.isOpen()) disconnected(now, "the connection ended");
  }
  return written.any;
}

// A message: what is batched leaves an interval after the first of it, at the latest.
void Session::wrote() {
  if (flushInterval_.count() > 0 && nextFlush_ == SteadyTime::max())
    nextFlush_ = std::chrono::steady_clock::now() + flushInterval_;
}

void Session::flushIfDue(SteadyTime now) {
  if (now < nextFlush_ || ending_) return;
  nextFlush_ = SteadyTime::max();
  Call call{Method::flushMessagesWithCompletion};
  if (const std::optional<uint32_t> serial = output_.call(call, false))
    unanswered_.addCall(*serial, std::make_unique<Command>(std::move(call)));
}

void Session::pingIfDue(SteadyTime now) {
  const std::optional<SteadyTime> due = unanswered_.nextPing();
  if (!due || now < *due) return;
  if (const std::optional<uint32_t> serial = output_.ping()) unanswered_.addPing(*serial, now);
}

void Session::readable(SteadyTime now) {
  const bool goesOn = connection_.read();
  const bool known = connection_.isTaken();
  const char* problem = connection_.shakeHands();
  if (connection_.isTaken() && !known) greet();
  if (connection_.isTaken() && problem == nullptr) problem = readMessages();
  if (done_) return;
  connection_.forgetHandled();
  if (problem == nullptr && !goesOn)
    problem =
        connection_.isTaken() ? "the connection ended" : "the connection ended before the daemon answered";
  if (problem != nullptr) disconnected(now, problem);
}

// What was wrong, or null.
const char* Session::readMessages() {
  Message message;
  while (!done_) {
    const Connection::Next next = connection_.next(message);
    if (next == Connection::Next::malformed) return "the daemon's answer was malformed";
    if (next == Connection::Next::none) return nullptr;
    handle(message);
  }
  return nullptr;
}

// The daemon has taken the connection.
void Session::greet() {
  connected_.store(true, std::memory_order_seq_cst);
  standing_.become(State::connected, reasonOfConnected(kept_.isConfigured()));
  if (!single_) tellAgain();
}

void Session::tellAgain() {
  const Replayed told = replay(kept_, [this](Call call) {
    libraryThread.assertCurrent();
    return sendAgain(std::move(call));
  });
  figures_.replayFailed.add(told.failed);
  if (told.identified) return;
  const std::string reason =
      "the session's information cannot be sent: larger than a megabyte, or nested too deeply";
  standing_.become(State::refused, reason);
  end(ClientError::invalid, reason);
}

bool Session::sendAgain(Call call) {
  const std::optional<uint32_t> serial = output_.call(call, connection_.passesDescriptors());
  if (!serial) return false;
  if (call.method == Method::setSessionInfo) return true;  // one way
  auto command = std::make_unique<Command>(std::move(call));
  command->replayed = true;
  unanswered_.addCall(*serial, std::move(command));
  return true;
}

void Session::handle(const Message& message) {
  switch (message.type) {
    case wire::MessageType::methodReturn:
    case wire::MessageType::error:
      handleReply(message);
      return;
    case wire::MessageType::methodCall:
      if (!aggregation_.handle(message) && message.expectsReply()) output_.refuse(message.serial);
      return;
    case wire::MessageType::signal:
      return;
  }
}

void Session::handleReply(const Message& message) {
  const std::unique_ptr<Command> command = unanswered_.take(message.replySerial);
  if (!command) return;
  const bool last = command->call.method == Method::finishSessionGracefully || single_;
  complete(*command, message);
  if (last) end(ClientError::closed, "the session was closed");
}

void Session::complete(Command& command, const Message& message) {
  const Method method = command.call.method;
  if (message.type == wire::MessageType::error) {
    const std::string text = daemonError(message).localizedDescription;
    standing_.say(std::string(wire::contractOf(method).member) + ": " + text);
    if (command.replayed) figures_.replayFailed.add();
    command.call.answer.fail(ClientError::refused, text);
    return;
  }
  std::optional<Reply> reply = readReply(method, message);
  if (!reply)
    return command.call.answer.fail(ClientError::refused,
                                    "the daemon's answer has another form than this library knows");
  if (const auto* names = std::get_if<StateNames>(&reply->result)) learnStates(*names);
  command.call.answer.give(std::move(*reply));
}

void Session::learnStates(const StateNames& names) {
  if (!kept_.isConfigured()) return;
  if (!names) return standing_.become(State::noStorebag, kept_.whyNoStorebag());
  if (names->empty()) return standing_.become(State::noLiveBackEnd, kept_.whyNotLive());
  std::string live;
  for (const std::string& name : *names) live += (live.empty() ? "" : " ") + name;
  standing_.become(State::live, std::move(live));
}

}  // namespace kyt::client
