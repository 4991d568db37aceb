// A session's queue, which any thread fills, and its end. SessionConnection.cpp has the connection.
#include "client/Session.h"

#include <algorithm>
#include <utility>

#include "client/Loop.h"

namespace kyt::client {

namespace {

using std::chrono::milliseconds;
using Steady = std::chrono::steady_clock;

constexpr milliseconds kLongestWait = std::chrono::years(50);  // a clock's nanoseconds end soon after 200

std::string problemOf(const Dictionary& sessionInfo) {
  const std::optional<Error> error = KYTReporting::checkSessionInfo(sessionInfo);
  return error ? error->localizedDescription : "";
}

std::string nameOf(const Dictionary& sessionInfo, bool single) {
  const Value* id = sessionInfo.find(kKYTReportingSessionInfoSessionID);
  return (single ? "single message of session " : "session ") + (id != nullptr ? description(*id) : "0");
}

std::string secondsText(milliseconds time) {
  return description(Value(static_cast<double>(time.count()) / 1000)) + " s";
}

}  // namespace

Session::Session(KYTReporting::Options options, Loop* loop, bool single,
                 const KYTReporting::Behaviour& behaviour)
    : problem_(problemOf(options.sessionInfo)),
      single_(single),
      callDeadline_(std::min(options.callDeadline, kLongestWait)),
      finishWaitsForDaemon_(options.finishWaitsForDaemon),
      waitForDaemon_(behaviour.waitForDaemon),
      flushInterval_(std::min(behaviour.flushInterval, kLongestWait)),
      loop_(loop),
      queue_(options.maxQueuedMessages, options.maxQueuedBytes),
      standing_(nameOf(options.sessionInfo, single), std::move(options.onStateChange)),
      kept_({std::move(options.sessionInfo), std::move(options.userInfo),
             std::move(options.frameworksToCheck), static_cast<bool>(options.aggregationBlock)}),
      aggregation_(std::move(options.aggregationBlock)),
      connection_(std::move(options.socketPath)) {
  loop_->enroll(*this);
  if (problem_.empty()) return;
  closed_ = true;
  standing_.become(KYTReporting::State::refused, problem_);
}

Session::~Session() {
  // What was queued while the session ended.
  for (Answer& answer : emptyQueue()) answer.fail(ClientError::closed, "the session is closed");
  loop_->retire(*this);
}

// Counts its messages as lost; returns the answers of its calls.
std::vector<Answer> Session::emptyQueue() {
  std::vector<Answer> answers;
  OutgoingQueue::Item item;
  while (queue_.pop(item)) {
    if (item.isMessage()) figures_.lostInQueue.add();
    if (item.command) answers.push_back(std::move(item.command->call.answer));
  }
  return answers;
}

bool Session::enqueueMessage(uint32_t category, uint32_t type, Dictionary&& payload, uint32_t flag) {
  if ((category | type) > UINT16_MAX) {
    standing_.say("message of " + outOfRange(category, type));
    countInvalid();
    return false;
  }
  if (refuses()) {
    countRefusal();
    return false;
  }
  if (!queue_.pushMessage(
          {static_cast<uint16_t>(category), static_cast<uint16_t>(type), flag, std::move(payload)})) {
    figures_.droppedQueueFull.add();
    return false;
  }
  // Without a connection the thread looks at the queue by itself as soon as it has one.
  if (connected_.load(std::memory_order_seq_cst)) loop_->noticeWork();
  return true;
}

void Session::enqueueCommand(std::unique_ptr<Command> command) {
  const bool isMessage = command->isMessage();
  if (refuses()) {
    if (isMessage) countRefusal();
    const Error error = refusal();
    command->call.answer.fail(static_cast<ClientError>(error.code), error.localizedDescription);
    return;
  }
  if (callDeadline_.count() > 0 && command->call.method != Method::finishSessionGracefully &&
      command->call.answer.isAwaited())
    command->deadline = Steady::now() + callDeadline_;
  command = queue_.pushCommand(std::move(command));
  if (command) {
    if (isMessage) figures_.droppedQueueFull.add();
    command->call.answer.fail(ClientError::queueFull, "the queue is full");
  }
  loop_->noticeWork();
}

void Session::countRefusal() {
  (problem_.empty() ? figures_.droppedClosed : figures_.droppedInvalid).add();
}

Error Session::refusal() const {
  if (!problem_.empty()) return clientError(ClientError::invalid, problem_);
  if (unserved_) return clientError(ClientError::notConnected, standing_.why());
  return clientError(ClientError::closed, "the session is closed");
}

KYTReporting::Statistics Session::statistics() const {
  return figures_.statistics(queue_.accepted(), queue_.messages());
}

std::string Session::stateReason() const {
  // A lock of the parent's library thread may be held for ever in a child.
  return inert_ ? "the session belongs to the parent of this process" : standing_.why();
}

bool Session::finishAndWait(milliseconds timeout) {
  if (refuses()) return false;
  KYTReporting::SuccessCompletion said = [this](bool success, const std::optional<Error>&) {
    waiters_.goodbyeAnswered(success);
  };
  enqueueCommand(std::make_unique<Command>(Call{Method::finishSessionGracefully, {}, std::move(said)}));
  saidGoodbye_ = true;
  if (loop_->isCurrentThread()) return false;
  loop_->wake();  // without a daemon it gives up at once
  return waiters_.waitForGoodbye(std::min(timeout, kLongestWait));
}

void Session::close() {
  const bool within = !inert_ && loop_->isCurrentThread();
  stop();
  if (within) return;
  libraryThread.assertCurrent();  // nothing runs there for this session
  standing_.sayDrops(statistics());
}

void Session::stop() {
  if (inert_) return;
  closed_ = true;
  if (loop_->isCurrentThread()) {
    libraryThread.assertCurrent();
    return end(ClientError::closed, "the session was closed");
  }
  loop_->wake();
  waiters_.waitForEnd();
}

void Session::becomeInert() {
  libraryThread.assertCurrent();  // the parent has it
  inert_ = true;
  connection_.close();
}

void Session::endUnserved() {
  libraryThread.assertCurrent();  // there is none
  const std::string reason = problem_.empty() ? "the system gives the library no thread" : problem_;
  if (problem_.empty()) standing_.become(KYTReporting::State::noDaemon, reason);
  unserved_ = true;
  end(problem_.empty() ? ClientError::notConnected : ClientError::invalid, reason);
}

void Session::end(ClientError code, const std::string& reason) {
  if (done_) return failAll({}, code, reason);
  done_ = true;
  closed_ = true;
  connected_ = false;
  connection_.close();
  // All is counted before anyone is told of the end.
  Unanswered::Left left = unanswered_.takeAll();
  figures_.lostOnConnectionEnd.add(left.messages);
  for (Answer& answer : emptyQueue()) left.answers.push_back(std::move(answer));
  standing_.sayDrops(statistics());
  standing_.announce();
  standing_.dropBlock();
  failAll(std::move(left.answers), code, reason);
  aggregation_.end();
  waiters_.sessionEnded();
}

// A completion may close the session: then the others have run before close() returns, and not with what the program
// has freed by then.
void Session::failAll(std::vector<Answer> answers, ClientError code, const std::string& reason) {
  for (Answer& answer : answers) failing_.push_back({std::move(answer), code, reason});
  while (!failing_.empty()) {
    Failing failing = std::move(failing_.front());
    failing_.pop_front();
    failing.answer.fail(failing.code, failing.reason);
  }
}

// Completions that waited too long for a daemon get an error.
void Session::expire(SteadyTime now) {
  if (connection_.isTaken()) return queue_.suspendDeadlines();
  OutgoingQueue::Expired late = queue_.takeExpired(now);
  if (late.answers.empty()) return;
  figures_.waitedTooLong.add(late.answers.size());
  figures_.droppedTooLate.add(late.messages);
  const std::string reason = "no daemon within " + secondsText(callDeadline_) + ": " + standing_.why();
  failAll(std::move(late.answers), ClientError::timedOut, reason);
  // Nothing is left of it but a connection, which would keep the daemon from its idle end.
  if (single_) end(ClientError::timedOut, reason);
}

}  // namespace kyt::client
