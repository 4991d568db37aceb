// A session's queue, which any thread fills, and its end. SessionConnection.cpp has the connection.
#include "client/Session.h"

#include <algorithm>
#include <utility>

#include "client/Loop.h"
#include "client/WireSize.h"

namespace kyt::client {

namespace {

using std::chrono::milliseconds;
using Steady = std::chrono::steady_clock;

constexpr size_t kMaxOverflow = 4096;                          // commands
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

Session::Session(KYTReporting::Options options, Loop* loop, bool single)
    : problem_(problemOf(options.sessionInfo)),
      path_(std::move(options.socketPath)),
      single_(single),
      maxQueuedBytes_(std::max<size_t>(options.maxQueuedBytes, 4096)),
      callDeadline_(std::min(options.callDeadline, kLongestWait)),
      finishWaitsForDaemon_(options.finishWaitsForDaemon),
      loop_(loop),
      ring_(std::clamp<size_t>(options.maxQueuedMessages, 64, 65536)),
      standing_(nameOf(options.sessionInfo, single), std::move(options.onStateChange)),
      kept_({std::move(options.sessionInfo), std::move(options.userInfo),
             std::move(options.frameworksToCheck), static_cast<bool>(options.aggregationBlock)}),
      aggregationBlock_(std::move(options.aggregationBlock)) {
  if (problem_.empty()) return;
  closed_ = true;
  standing_.become(KYTReporting::State::refused, problem_);
}

Session::~Session() {
  // Commands that were queued while the session ended.
  Item item;
  while (nextItem(item))
    if (item.command) item.command->call.answer.fail(ClientError::closed, "the session is closed");
}

bool Session::enqueueMessage(uint32_t category, uint32_t type, Dictionary&& payload, uint32_t flag) {
  if ((category | type) > UINT16_MAX) {
    standing_.say("message of " + outOfRange(category, type));
    droppedInvalid_.fetch_add(1, std::memory_order_relaxed);
    return false;
  }
  if (refuses()) {
    (problem_.empty() ? droppedClosed_ : droppedInvalid_).fetch_add(1, std::memory_order_relaxed);
    return false;
  }
  Item item;
  const size_t bytes = messageBytes(payload);
  item.bytes = static_cast<uint32_t>(std::min<size_t>(bytes, UINT32_MAX));
  item.message = {static_cast<uint16_t>(category), static_cast<uint16_t>(type), flag, std::move(payload)};
  const size_t before = queuedBytes_.fetch_add(item.bytes, std::memory_order_relaxed);
  const uint32_t counted = item.bytes;
  if (before + counted > maxQueuedBytes_ || overflowed_.load(std::memory_order_relaxed) > 0 ||
      !ring_.push(std::move(item))) {
    queuedBytes_.fetch_sub(counted, std::memory_order_relaxed);
    droppedQueueFull_.fetch_add(1, std::memory_order_relaxed);
    return false;
  }
  noticeWork();
  return true;
}

void Session::enqueueCommand(std::unique_ptr<Command> command) {
  if (refuses()) {
    const Error error = refusal();
    command->call.answer.fail(static_cast<ClientError>(error.code), error.localizedDescription);
    return;
  }
  if (callDeadline_.count() > 0 && command->call.method != Method::finishSessionGracefully &&
      command->call.answer.isAwaited())
    command->deadline = Steady::now() + callDeadline_;
  Item item;
  item.command = std::move(command);
  // NOLINTBEGIN(bugprone-use-after-move): push() leaves what it refuses.
  if (overflowed_.load() > 0 || !ring_.push(std::move(item))) {
    MutexLock lock(overflowMutex_);
    if (overflow_.size() < kMaxOverflow) {
      overflow_.push_back(std::move(item.command));
      overflowed_.fetch_add(1);
    }
  }
  if (item.command) item.command->call.answer.fail(ClientError::queueFull, "the queue is full");
  // NOLINTEND(bugprone-use-after-move)
  commandQueued_.store(true);
  loop_->noticeWork();
}

Error Session::refusal() const {
  if (!problem_.empty()) return clientError(ClientError::invalid, problem_);
  if (unserved_) return clientError(ClientError::notConnected, standing_.why());
  return clientError(ClientError::closed, "the session is closed");
}

void Session::noticeWork() {
  // Without a connection the thread looks at the queue by itself as soon as it has one.
  if (connected_.load(std::memory_order_seq_cst)) loop_->noticeWork();
}

KYTReporting::Statistics Session::statistics() const {
  KYTReporting::Statistics figures;
  figures.sent = sent_.load(std::memory_order_relaxed);
  figures.droppedQueueFull = droppedQueueFull_.load(std::memory_order_relaxed);
  figures.lostOnConnectionEnd = lost_.load(std::memory_order_relaxed);
  figures.droppedClosed = droppedClosed_.load(std::memory_order_relaxed);
  figures.droppedInvalid = droppedInvalid_.load(std::memory_order_relaxed);
  figures.connections = connections_.load(std::memory_order_relaxed);
  figures.queued = ring_.size() + overflowed_.load(std::memory_order_relaxed);
  figures.waitedTooLong = waitedTooLong_.load(std::memory_order_relaxed);
  figures.replayFailed = replayFailed_.load(std::memory_order_relaxed);
  figures.sentUnconfigured = sentUnconfigured_.load(std::memory_order_relaxed);
  return figures;
}

std::string Session::stateReason() const {
  // A lock of the parent's library thread may be held for ever in a child.
  return inert_ ? "the session belongs to the parent of this process" : standing_.why();
}

bool Session::finishAndWait(milliseconds timeout) {
  if (refuses()) return false;
  KYTReporting::SuccessCompletion said = [this](bool success, const std::optional<Error>&) {
    MutexLock lock(stateMutex_);
    finished_ = finished_ || success;  // a second goodbye that fails takes nothing back
    goodbyeOver_ = true;
    stateChanged_.notifyAll();
  };
  enqueueCommand(std::make_unique<Command>(Call{Method::finishSessionGracefully, {}, std::move(said)}));
  saidGoodbye_ = true;
  if (loop_->isCurrentThread()) return false;
  loop_->wake();  // without a daemon it gives up at once
  const MonotonicTime end = std::chrono::steady_clock::now() + std::min(timeout, kLongestWait);
  MutexLock lock(stateMutex_);
  while (!goodbyeOver_ && stateChanged_.waitUntil(stateMutex_, end)) continue;
  return finished_;
}

void Session::close() {
  if (!inert_) {
    closed_ = true;
    if (loop_->isCurrentThread()) {
      end(ClientError::closed, "the session was closed");
      return;
    }
    loop_->wake();
    MutexLock lock(stateMutex_);
    while (!ended_) stateChanged_.wait(stateMutex_);
  }
  standing_.sayDrops(statistics());
}

void Session::becomeInert() {
  inert_ = true;
  socket_.close();
}

void Session::endUnserved() {
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
  socket_.close();
  // All is counted before anyone is told of the end.
  uint64_t lost = 0;
  for (const Unacknowledged& entry : unacknowledged_) lost += entry.count;
  unacknowledged_.clear();
  std::vector<Answer> answers;
  for (Pending& entry : pending_) answers.push_back(std::move(entry.command->call.answer));
  pending_.clear();
  Item item;
  while (nextItem(item)) {
    if (item.command)
      answers.push_back(std::move(item.command->call.answer));
    else
      ++lost;
  }
  lost_.fetch_add(lost);
  standing_.sayDrops(statistics());
  standing_.announce();
  standing_.dropBlock();
  failAll(std::move(answers), code, reason);
  aggregationBlock_ = nullptr;
  MutexLock lock(stateMutex_);
  goodbyeOver_ = true;
  ended_ = true;
  stateChanged_.notifyAll();
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

bool Session::nextItem(Item& item) {
  if (ring_.pop(item)) {
    queuedBytes_.fetch_sub(item.bytes, std::memory_order_relaxed);
    return true;
  }
  if (overflowed_.load() == 0) return false;
  MutexLock lock(overflowMutex_);
  if (overflow_.empty()) return false;
  item = Item();
  item.command = std::move(overflow_.front());
  overflow_.pop_front();
  overflowed_.fetch_sub(1);
  return true;
}

// Completions that waited too long for a daemon get an error. Their commands stay where they stand in the queue.
void Session::expire(SteadyTime now) {
  const bool looksAgain = commandQueued_.exchange(false);
  if (handshakeDone_ || (!looksAgain && now < nextExpiry_)) return;
  nextExpiry_ = SteadyTime::max();
  std::vector<Answer> late;
  const auto look = [&](const std::unique_ptr<Command>& command) {
    if (!command || !command->deadline) return;
    if (*command->deadline > now) {
      nextExpiry_ = std::min(nextExpiry_, *command->deadline);
      return;
    }
    command->deadline.reset();
    command->given = command->staysGiven();
    late.push_back(std::exchange(command->call.answer, {}));
  };
  ring_.forEach([&look](const Item& item) { look(item.command); });
  {
    MutexLock lock(overflowMutex_);
    for (const auto& command : overflow_) look(command);
  }
  if (late.empty()) return;
  waitedTooLong_.fetch_add(late.size());
  const std::string reason = "no daemon within " + secondsText(callDeadline_) + ": " + standing_.why();
  failAll(std::move(late), ClientError::timedOut, reason);
  // Nothing is left of it but a connection, which would keep the daemon from its idle end.
  if (single_) end(ClientError::timedOut, reason);
}

}  // namespace kyt::client
