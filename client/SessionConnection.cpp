// A session's connection: the library's thread alone.
#include <algorithm>
#include <utility>

#include "client/Replay.h"
#include "client/Session.h"
#include "platform/ipc/MessageReader.h"

namespace kyt::client {

namespace {

using linux_client::ClientSocket;
using linux_client::Outcome;
using State = KYTReporting::State;
using std::chrono::milliseconds;

// Encoded bytes waiting for the socket: what a broken connection can lose.
constexpr size_t kWriteAhead = 64 * 1024;
constexpr uint64_t kMaxReplyBytes = 64u << 20;
constexpr milliseconds kPingInterval{250}, kFirstBackoff{100}, kLastBackoff{5000};
// Connections in a row that end before the daemon's first byte. It tells a client that it refuses nothing; one
// such end may be the daemon's own.
constexpr unsigned kRefusals = 2;

const char* reasonOfConnected(bool configured) {
  return configured ? "the configuration is on its way" : "startConfiguration was not called yet";
}

}  // namespace

bool Session::hasWork() const {
  return closed_.load() || queue_.hasNewCommand() || (handshakeDone_ && !queue_.isEmpty());
}

std::optional<SteadyTime> Session::nextDeadline() const {
  if (handshakeDone_) {
    if (!unacknowledged_.empty() && !ping_) return lastPing_ + kPingInterval;
    return std::nullopt;
  }
  const SteadyTime next =
      socket_.isOpen() ? queue_.nextDeadline() : std::min(queue_.nextDeadline(), nextAttempt_);
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
  if (socket_.isOpen()) return true;
  if (saidGoodbye_ && !std::exchange(triedAtGoodbye_, true)) nextAttempt_ = now;
  if (now >= nextAttempt_) connect(now);
  if (!done_ && givesUp()) end(ClientError::notConnected, standing_.why());
  return !done_ && socket_.isOpen();
}

// Nothing was ever taken, and nobody is there to take anything: a program that ends need not wait.
bool Session::givesUp() const {
  return saidGoodbye_ && triedAtGoodbye_ && nobodyThere_ && !everTaken_ && !finishWaitsForDaemon_ &&
         !socket_.isOpen();
}

bool Session::move(SteadyTime now) {
  bool moved = false;
  for (;;) {
    const bool drained = handshakeDone_ && !ending_ && drain();
    if (handshakeDone_) pingIfDue(now);
    const bool written = wantsToWrite() && write(now);
    moved |= drained || written;
    if (!drained || wantsToWrite() || !socket_.isOpen()) return moved;
  }
}

void Session::connect(SteadyTime now) {
  ClientSocket made;
  std::string problem;
  const Outcome outcome = ClientSocket::connect(path_, made, problem);
  if (outcome != Outcome::done) {
    nobodyThere_ = outcome == Outcome::ended;
    endedInHandshake_ = 0;
    backoff_ = std::clamp(backoff_ * 2, kFirstBackoff, kLastBackoff);
    nextAttempt_ = now + backoff_;
    standing_.become(State::noDaemon, problem);
    if (single_ && nobodyThere_) end(ClientError::notConnected, problem);
    return;
  }
  socket_ = std::move(made);
  figures_.connections.add();
  handshake_ = ClientHandshake();
  handshakeDone_ = false;
  output_.restart(ClientHandshake::opening(linux_client::effectiveUser()));
  if (standing_.state() == State::noDaemon)
    standing_.note(State::noDaemon, path_ + ": the daemon has not answered yet");
}

void Session::disconnected(SteadyTime now, std::string reason) {
  if (done_) return;
  reason = path_ + ": " + reason;
  const bool taken = handshakeDone_;
  // A daemon that ends says so, and the next one takes the connection; one that cannot say so any more, or refuses,
  // is silent.
  if (std::exchange(daemonEnds_, false))
    endedInHandshake_ = 0;
  else if (!taken)
    nobodyThere_ = ++endedInHandshake_ >= kRefusals;
  const bool refused = !taken && nobodyThere_;
  if (refused)
    reason +=
        ": the daemon refuses this user and program (kytctl entitlements check says why), or has too many "
        "connections";
  standing_.become(refused ? State::refused : State::noDaemon, reason);
  socket_.close();
  connected_ = false;
  handshakeDone_ = false;
  ping_.reset();
  queue_.lookAgain();  // deadlines count again
  in_.clear();
  output_.restart();
  uint64_t lost = 0;
  for (const Unacknowledged& entry : unacknowledged_) lost += entry.count;
  unacknowledged_.clear();
  figures_.lostOnConnectionEnd.add(lost);
  backoff_ = std::clamp(backoff_ * 2, kFirstBackoff, kLastBackoff);
  nextAttempt_ = now + backoff_;
  std::vector<Answer> unanswered;
  for (Pending& entry : pending_) unanswered.push_back(std::move(entry.command->call.answer));
  pending_.clear();
  failAll(std::move(unanswered), ClientError::notConnected, reason);
  if (ending_ || (single_ && (taken || refused))) end(ClientError::notConnected, reason);
}

bool Session::drain() {
  bool any = false;
  Item item;
  while (output_.waiting() < kWriteAhead && !ending_ && queue_.pop(item)) {
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
    figures_.droppedInvalid.add();
    return;
  }
  figures_.sent.add();
  if (!kept_.isConfigured() && figures_.sentUnconfigured.add() == 0)
    standing_.become(State::connected,
                     "messages are sent, and startConfiguration was not called: the daemon drops them");
  if (unacknowledged_.empty() || unacknowledged_.back().serial != *serial - 1)
    unacknowledged_.push_back({0, 0});
  unacknowledged_.back().serial = *serial;
  ++unacknowledged_.back().count;
}

void Session::drainCommand(std::unique_ptr<Command> command) {
  if (!command->given) return;
  Call& call = command->call;
  if (call.method == Method::finishSessionGracefully) ending_ = true;
  const std::optional<uint32_t> serial = output_.call(call, handshake_.descriptorsAgreed());
  if (!serial) {
    figures_.droppedInvalid.add();
    call.answer.fail(ClientError::invalid, "the arguments cannot be sent: too large, or nested too deeply");
    return;
  }
  kept_.takeOver(call);
  if (call.method == Method::startConfigWithCompletionHandler && standing_.state() == State::connected)
    standing_.note(State::connected, reasonOfConnected(true));
  pending_.push_back({*serial, std::move(command)});
}

bool Session::write(SteadyTime now) {
  const Output::Written written = output_.writeTo(socket_);
  if (written.ended) {
    readable(now);  // what the daemon said before it ended the connection
    if (!done_ && socket_.isOpen()) disconnected(now, "the connection ended");
  }
  return written.any;
}

void Session::pingIfDue(SteadyTime now) {
  if (unacknowledged_.empty() || ping_ || now - lastPing_ < kPingInterval) return;
  ping_ = output_.ping();
  if (!ping_) return;
  lastPing_ = now;
}

void Session::readable(SteadyTime now) {
  Outcome outcome = Outcome::done;
  for (int reads = 0; reads < 16 && outcome == Outcome::done; ++reads) outcome = socket_.read(in_);
  size_t at = 0;
  const char* problem = !handshakeDone_ && !in_.empty() ? readHandshake(at) : nullptr;
  if (handshakeDone_ && problem == nullptr) problem = readMessages(at);
  if (done_) return;
  in_.erase(0, at);
  if (problem == nullptr && outcome == Outcome::ended)
    problem = handshakeDone_ ? "the connection ended" : "the connection ended before the daemon answered";
  if (problem != nullptr) disconnected(now, problem);
}

// What was wrong, or null; `at` goes on by what was read.
const char* Session::readHandshake(size_t& at) {
  size_t consumed = 0;
  const auto status = handshake_.feed(std::as_bytes(std::span(in_)).subspan(at), consumed);
  at += consumed;
  if (status == ClientHandshake::Status::failed) {
    daemonEnds_ = handshake_.serverEnds();
    if (!daemonEnds_) endedInHandshake_ = kRefusals;
    return handshake_.problem();
  }
  if (status != ClientHandshake::Status::done) return nullptr;
  handshakeDone_ = everTaken_ = true;
  nobodyThere_ = false;
  endedInHandshake_ = 0;
  connected_.store(true, std::memory_order_seq_cst);
  backoff_ = milliseconds(0);
  standing_.become(State::connected, reasonOfConnected(kept_.isConfigured()));
  if (!single_) tellAgain();
  return nullptr;
}

void Session::tellAgain() {
  const Replayed told = replay(kept_, [this](Call call) { return sendAgain(std::move(call)); });
  figures_.replayFailed.add(told.failed);
  if (told.identified) return;
  const std::string reason =
      "the session's information cannot be sent: larger than a megabyte, or nested too deeply";
  standing_.become(State::refused, reason);
  end(ClientError::invalid, reason);
}

bool Session::sendAgain(Call call) {
  const std::optional<uint32_t> serial = output_.call(call, handshake_.descriptorsAgreed());
  if (!serial) return false;
  if (call.method == Method::setSessionInfo) return true;  // one way
  auto command = std::make_unique<Command>(std::move(call));
  command->replayed = true;
  pending_.push_back({*serial, std::move(command)});
  return true;
}

const char* Session::readMessages(size_t& at) {
  while (at < in_.size() && !done_) {
    Message message;
    const Frame frame = readMessage(std::as_bytes(std::span(in_)).subspan(at), kMaxReplyBytes, message);
    if (frame.status == FrameStatus::incomplete) return nullptr;
    if (frame.status == FrameStatus::tooLong || frame.status == FrameStatus::malformed)
      return "the daemon's answer was malformed";
    if (frame.status == FrameStatus::complete) handle(message);
    at += frame.size;
  }
  return nullptr;
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

void Session::acknowledge(uint32_t serial) {
  while (!unacknowledged_.empty() && static_cast<int32_t>(unacknowledged_.front().serial - serial) < 0)
    unacknowledged_.pop_front();
}

void Session::handleReply(const Message& message) {
  if (ping_ == message.replySerial) {
    acknowledge(message.replySerial);
    ping_.reset();
    return;
  }
  const auto found = std::find_if(pending_.begin(), pending_.end(), [&message](const Pending& entry) {
    return entry.serial == message.replySerial;
  });
  if (found == pending_.end()) return;
  acknowledge(message.replySerial);
  std::unique_ptr<Command> command = std::move(found->command);
  pending_.erase(found);
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
