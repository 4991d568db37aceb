#include "client/Session.h"

#include <algorithm>
#include <utility>

#include "client/Loop.h"
#include "platform/ipc/MessageReader.h"
#include "platform/ipc/MessageWriter.h"

namespace kyt::client {

namespace {

using linux_client::ClientSocket;
using linux_client::Outcome;
using std::chrono::milliseconds;

constexpr size_t kWriteAhead =
    64 * 1024;  // encoded bytes waiting for the socket: what a broken connection can lose
constexpr size_t kMaxOverflow = 4096;  // commands
constexpr uint64_t kMaxReplyBytes = 64u << 20;
constexpr milliseconds kPingInterval{250}, kFirstBackoff{100}, kLastBackoff{5000};

// Roughly what the object takes on the wire; cheap, since the caller of sendMessage pays for it.
size_t wireBytes(const Value& value, int depth) {
  if (depth > 8) return 64;
  if (const String* text = value.string()) return 12 + text->size();
  if (const Data* data = value.data()) return 12 + data->size();
  size_t bytes = 16;
  if (const Dictionary* dictionary = value.dictionary()) {
    for (const DictionaryEntry& entry : *dictionary)
      bytes += 8 + entry.key.size() + wireBytes(entry.value, depth + 1);
  } else if (const Array* array = value.array()) {
    for (const Value& element : *array) bytes += wireBytes(element, depth + 1);
  }
  return bytes;
}

size_t messageBytes(const Dictionary& payload) {
  size_t bytes = 256;
  for (const DictionaryEntry& entry : payload) bytes += 8 + entry.key.size() + wireBytes(entry.value, 1);
  return bytes;
}

std::string problemOf(const Dictionary& sessionInfo) {
  const std::optional<Error> error = KYTReporting::checkSessionInfo(sessionInfo);
  return error ? error->localizedDescription : "";
}

}  // namespace

Session::Session(KYTReporting::Options options, Loop* loop, bool single)
    : problem_(problemOf(options.sessionInfo)),
      path_(std::move(options.socketPath)),
      single_(single),
      maxQueuedBytes_(std::max<size_t>(options.maxQueuedBytes, 4096)),
      loop_(loop),
      ring_(std::clamp<size_t>(options.maxQueuedMessages, 64, 65536)),
      sessionInfo_(std::move(options.sessionInfo)),
      userInfo_(std::move(options.userInfo)),
      frameworks_(std::move(options.frameworksToCheck)),
      aggregationBlock_(std::move(options.aggregationBlock)) {
  closed_ = !problem_.empty();
}

Session::~Session() {
  // Commands that were queued while the session ended.
  Item item;
  while (nextItem(item))
    if (item.command) item.command->fail(ClientError::closed, "the session is closed");
  for (const Mark& mark : marks_)
    for (const int descriptor : mark.descriptors) linux_client::closeDescriptor(descriptor);
}

bool Session::enqueueMessage(uint16_t category, uint16_t type, Dictionary&& payload, uint32_t flag) {
  if (refuses()) {
    (problem_.empty() ? droppedClosed_ : droppedInvalid_).fetch_add(1, std::memory_order_relaxed);
    return false;
  }
  Item item;
  item.category = category;
  item.type = type;
  item.flag = flag;
  const size_t bytes = messageBytes(payload);
  item.bytes = static_cast<uint32_t>(std::min<size_t>(bytes, UINT32_MAX));
  item.payload = std::move(payload);
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
    command->fail(static_cast<ClientError>(error.code), error.localizedDescription);
    return;
  }
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
  if (item.command) item.command->fail(ClientError::queueFull, "the queue is full");
  // NOLINTEND(bugprone-use-after-move)
  noticeWork();
}

Error Session::refusal() const {
  return problem_.empty() ? clientError(ClientError::closed, "the session is closed")
                          : clientError(ClientError::invalid, problem_);
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
  return figures;
}

bool Session::finishAndWait(milliseconds timeout) {
  if (refuses()) return false;
  auto command = std::make_unique<Command>(Command::Kind::finish);
  command->successCompletion = [this](bool success, std::optional<Error>) {
    MutexLock lock(stateMutex_);
    finished_ = success;
    goodbyeOver_ = true;
    stateChanged_.notify_all();
  };
  enqueueCommand(std::move(command));
  saidGoodbye_ = true;
  if (loop_->isCurrentThread()) return false;
  std::unique_lock<std::mutex> lock(stateMutex_.native());
  stateChanged_.wait_for(lock, timeout, [this]() NO_THREAD_SAFETY_ANALYSIS { return goodbyeOver_; });
  return [this]() NO_THREAD_SAFETY_ANALYSIS { return finished_; }();
}

void Session::close() {
  if (inert_) return;
  closed_ = true;
  if (loop_->isCurrentThread()) {
    end(ClientError::closed, "the session was closed");
    return;
  }
  loop_->wake();
  std::unique_lock<std::mutex> lock(stateMutex_.native());
  stateChanged_.wait(lock, [this]() NO_THREAD_SAFETY_ANALYSIS { return ended_; });
}

void Session::becomeInert() {
  inert_ = true;
  socket_.close();
}

void Session::end(ClientError code, const char* reason) {
  if (done_) return;
  done_ = true;
  closed_ = true;
  connected_ = false;
  socket_.close();
  std::deque<Pending> pending;
  pending.swap(pending_);
  for (Pending& entry : pending) entry.command->fail(code, reason);
  uint64_t lost = 0;
  for (const Unacknowledged& entry : unacknowledged_) lost += entry.count;
  unacknowledged_.clear();
  Item item;
  while (nextItem(item)) {
    if (item.command)
      item.command->fail(code, reason);
    else
      ++lost;
  }
  lost_.fetch_add(lost);
  aggregationBlock_ = nullptr;
  MutexLock lock(stateMutex_);
  goodbyeOver_ = true;
  ended_ = true;
  stateChanged_.notify_all();
}

bool Session::hasWork() const {
  return closed_.load() || ((!ring_.empty() || overflowed_.load() > 0) && handshakeDone_);
}

std::optional<SteadyTime> Session::nextDeadline() const {
  if (!socket_.isOpen()) return nextAttempt_;
  if (!unacknowledged_.empty() && !pingOutstanding_) return lastPing_ + kPingInterval;
  return std::nullopt;
}

bool Session::pump(SteadyTime now) {
  if (done_) return false;
  if (closed_) {
    end(ClientError::closed, "the session was closed");
    return false;
  }
  if (!socket_.isOpen()) {
    if (now < nextAttempt_) return false;
    connect(now);
    if (!socket_.isOpen()) return false;
  }
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
  const Outcome outcome = ClientSocket::connect(path_, made);
  if (outcome != Outcome::done) {
    if (single_ && outcome == Outcome::ended) {
      end(ClientError::notConnected, "no daemon listens");
      return;
    }
    backoff_ = std::clamp(backoff_ * 2, kFirstBackoff, kLastBackoff);
    nextAttempt_ = now + backoff_;
    return;
  }
  socket_ = std::move(made);
  connections_.fetch_add(1);
  handshake_ = ClientHandshake();
  handshakeDone_ = false;
  out_ = ClientHandshake::opening(linux_client::effectiveUser());
  outAt_ = 0;
}

void Session::disconnected(SteadyTime now, const char* reason) {
  if (done_) return;
  socket_.close();
  connected_ = false;
  handshakeDone_ = pingOutstanding_ = false;
  in_.clear();
  out_.clear();
  outAt_ = 0;
  for (const Mark& mark : marks_)
    for (const int descriptor : mark.descriptors) linux_client::closeDescriptor(descriptor);
  marks_.clear();
  uint64_t lost = 0;
  for (const Unacknowledged& entry : unacknowledged_) lost += entry.count;
  unacknowledged_.clear();
  lost_.fetch_add(lost);
  backoff_ = std::clamp(backoff_ * 2, kFirstBackoff, kLastBackoff);
  nextAttempt_ = now + backoff_;
  std::deque<Pending> pending;
  pending.swap(pending_);
  for (Pending& entry : pending) entry.command->fail(ClientError::notConnected, reason);
  if (single_ || ending_) end(ClientError::notConnected, reason);
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

bool Session::drain() {
  bool any = false;
  Item item;
  while (out_.size() - outAt_ < kWriteAhead && !ending_ && nextItem(item)) {
    any = true;
    if (!item.command) {
      if (!encodeMessage(item)) {
        droppedInvalid_.fetch_add(1);
        continue;
      }
      sent_.fetch_add(1, std::memory_order_relaxed);
      if (unacknowledged_.empty() || unacknowledged_.back().serial != serial_ - 1)
        unacknowledged_.push_back({0, 0});
      unacknowledged_.back().serial = serial_;
      ++unacknowledged_.back().count;
      continue;
    }
    if (item.command->kind == Command::Kind::finish) ending_ = true;
    const uint32_t serial = ++serial_;
    if (!encodeCommand(*item.command, serial)) {
      droppedInvalid_.fetch_add(1);
      item.command->fail(ClientError::invalid,
                         "the arguments cannot be sent: too large, or nested too deeply");
      continue;
    }
    pending_.push_back({serial, std::move(item.command)});
  }
  return any;
}

bool Session::write(SteadyTime now) {
  bool any = false;
  while (wantsToWrite()) {
    std::vector<int> descriptors;
    size_t end = out_.size();
    const bool marked = !marks_.empty() && marks_.front().offset == outAt_;
    if (marked) descriptors = marks_.front().descriptors;
    const size_t next = marked ? 1 : 0;
    if (marks_.size() > next) end = marks_[next].offset;
    size_t written = 0;
    const Outcome outcome =
        socket_.write(std::string_view(out_).substr(outAt_, end - outAt_), descriptors, written);
    if (outcome == Outcome::wouldBlock) return any;
    if (outcome == Outcome::ended) {
      disconnected(now, "the connection ended");
      return any;
    }
    if (marked) {
      for (const int descriptor : descriptors) linux_client::closeDescriptor(descriptor);
      marks_.pop_front();
    }
    outAt_ += written;
    any = true;
  }
  out_.clear();
  outAt_ = 0;
  return any;
}

void Session::pingIfDue(SteadyTime now) {
  if (unacknowledged_.empty() || pingOutstanding_ || now - lastPing_ < kPingInterval) return;
  auto ping = std::make_unique<Command>(Command::Kind::ping);
  const uint32_t serial = ++serial_;
  if (!encodeCommand(*ping, serial)) return;
  pending_.push_back({serial, std::move(ping)});
  pingOutstanding_ = true;
  lastPing_ = now;
}

void Session::readable(SteadyTime now) {
  Outcome outcome = Outcome::done;
  for (int reads = 0; reads < 16 && outcome == Outcome::done; ++reads) outcome = socket_.read(in_);
  size_t at = 0;
  const auto rest = [this, &at] { return std::as_bytes(std::span(in_)).subspan(at); };
  const char* problem = nullptr;
  if (!handshakeDone_ && !in_.empty()) {
    size_t consumed = 0;
    const auto status = handshake_.feed(rest(), consumed);
    at = consumed;
    if (status == ClientHandshake::Status::failed) problem = "the daemon refused the connection";
    if (status == ClientHandshake::Status::done) {
      handshakeDone_ = true;
      connected_.store(true, std::memory_order_seq_cst);
      backoff_ = milliseconds(0);
      replay();
    }
  }
  while (handshakeDone_ && problem == nullptr && at < in_.size() && !done_) {
    Message message;
    const Frame frame = readMessage(rest(), kMaxReplyBytes, message);
    if (frame.status == FrameStatus::incomplete) break;
    if (frame.status == FrameStatus::tooLong || frame.status == FrameStatus::malformed) {
      problem = "the daemon's answer was malformed";
      break;
    }
    if (frame.status == FrameStatus::complete) handle(message);
    at += frame.size;
  }
  if (done_) return;
  in_.erase(0, at);
  if (problem == nullptr && outcome == Outcome::ended)
    problem =
        connections_ == 1 && !handshakeDone_ ? "the daemon refused the connection" : "the connection ended";
  if (problem != nullptr) disconnected(now, problem);
}

void Session::handle(const Message& message) {
  switch (message.type) {
    case wire::MessageType::methodReturn:
    case wire::MessageType::error:
      handleReply(message);
      return;
    case wire::MessageType::methodCall:
      handleCall(message);
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
  const auto found = std::find_if(pending_.begin(), pending_.end(), [&message](const Pending& entry) {
    return entry.serial == message.replySerial;
  });
  if (found == pending_.end()) return;
  acknowledge(message.replySerial);
  std::unique_ptr<Command> command = std::move(found->command);
  pending_.erase(found);
  if (command->kind == Command::Kind::ping) {
    pingOutstanding_ = false;
    return;
  }
  const bool last = command->kind == Command::Kind::finish || single_;
  complete(*command, message);
  if (last) end(ClientError::closed, "the session was closed");
}

}  // namespace kyt::client
