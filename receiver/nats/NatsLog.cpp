#include "receiver/nats/NatsLog.h"

#include <algorithm>
#include <chrono>
#include <utility>
#include <vector>

#include "platform/linux/base/Threads.h"

namespace kyt::receiver {
namespace {

constexpr std::chrono::milliseconds kAskAgain(500);
constexpr std::chrono::seconds kEndTime(5);
// Posts that follow each other more closely are written together.
constexpr std::chrono::microseconds kCollectTime(200);
// Of partitions, that share what tells that no stream takes their subject.
constexpr uint32_t kMostGroups = 64;
constexpr size_t kCollectBytes = 256 * 1024;

std::string textOf(natsStatus status) {
  return natsStatus_GetText(status);
}

std::string eventSubject(const std::string& partition) {
  return "kyt.events." + partition;
}

}  // namespace

NatsLog::NatsLog(const LogSettings& settings, Log& lines)
    : settings_(settings), lines_(lines), socket_(kWriteTime) {}

NatsLog::~NatsLog() {
  NatsLog::stop();
}

void NatsLog::start(LogListener& listener) {
  listener_ = &listener;
  thread_ = std::thread([this] { run(); });
}

void NatsLog::publish(uint64_t token, std::shared_ptr<const LogMessage> message) {
  writeOrQueue({token, std::move(message)});
}

void NatsLog::publishDeadLetter(std::shared_ptr<const LogMessage> message) {
  if (!isConnected_) return listener_->deadLetterAnswered(false);
  writeOrQueue({0, std::move(message)});
}

void NatsLog::writeOrQueue(Item item) {
  {
    MutexLock lock(mutex_);
    if (isStopping_) return;
    if (!queue_.empty() || socket_.isBehind() || socket_.sinceFlush() < kCollectTime) {
      if (queue_.empty()) socket_.wake();
      return queue_.push_back(std::move(item));
    }
    ++writers_;
  }
  write(item);
  socket_.flush();
  MutexLock lock(mutex_);
  if (--writers_ == 0 && isStopping_) changed_.notifyAll();
}

void NatsLog::stop() {
  {
    MutexLock lock(mutex_);
    if (isStopping_) return;
    isStopping_ = true;
    changed_.notifyAll();
    socket_.wake();
  }
  if (thread_.joinable()) thread_.join();
  {
    MutexLock lock(upMutex_);
    isEnding_ = true;
  }
  {
    MutexLock lock(mutex_);
    while (writers_ != 0) changed_.wait(mutex_);
  }
  if (connection_) natsConnection_Close(connection_.get());
  {
    const MonotonicTime deadline = std::chrono::steady_clock::now() + kEndTime;
    MutexLock lock(mutex_);
    while (!isClosed_ && changed_.waitUntil(mutex_, deadline)) {
    }
  }
  subscriptions_.clear();
  connection_.reset();
}

bool NatsLog::isStopping() {
  MutexLock lock(mutex_);
  return isStopping_;
}

void NatsLog::run() {
  beginServiceThread("kyt-log");
  while (!isStopping() && !connect()) {
    MutexLock lock(mutex_);
    if (!isStopping_) changed_.waitUntil(mutex_, std::chrono::steady_clock::now() + kAskAgain);
  }
  MonotonicTime asked{};
  while (!isStopping()) {
    // Which stream takes the events' subject: none as long as nobody has made it, or it has no leader.
    const MonotonicTime now = std::chrono::steady_clock::now();
    if (isConnected_ && !hasStream_ && !isTooSmall_ &&
        (mustAskStream_.exchange(false) || now >= asked + kAskAgain)) {
      asked = now;
      ask("$JS.API.STREAM.NAMES", "names", R"({"subject":")" + eventSubject("0") + R"("})");
    }
    socket_.wait(timeToWait());
    takeAnswers();
    if (socket_.sinceFlush() >= kCollectTime) writeQueue();
    // Posts go first.
    if (hasStream_ && mustAskRetention_.exchange(false))
      ask("$JS.API.STREAM.INFO." + settings_.stream, "info", "");
  }
}

Duration NatsLog::timeToWait() {
  MutexLock lock(mutex_);
  if (queue_.empty() || socket_.isBehind()) return kAskAgain;
  return std::max(kCollectTime - socket_.sinceFlush(), Duration(0));
}

std::optional<NatsLog::Item> NatsLog::takeItem() {
  MutexLock lock(mutex_);
  if (queue_.empty()) return {};
  Item item = std::move(queue_.front());
  queue_.pop_front();
  return item;
}

// Publishers fill the queue until it is empty, and then write again themselves.
void NatsLog::writeQueue() {
  size_t bytes = 0;
  while (!socket_.isBehind()) {
    const std::optional<Item> item = takeItem();
    if (!item) break;
    write(*item);
    bytes += item->message->body.size();
    if (bytes < kCollectBytes) continue;
    socket_.flush();
    bytes = 0;
  }
  socket_.flush();
}

uint32_t NatsLog::groups() const {
  return std::min(settings_.partitions, kMostGroups);
}

std::optional<uint64_t> NatsLog::maxBodyBytes() const {
  const uint64_t bytes = maxBodyBytes_.load();
  return bytes == kUnknown ? std::nullopt : std::optional(bytes);
}

void NatsLog::setUp(bool isUp) {
  MutexLock lock(upMutex_);
  if (!isEnding_ && std::exchange(isUp_, isUp) != isUp) listener_->logIsUp(isUp);
}

void NatsLog::ask(const std::string& subject, const char* what, const std::string& request) {
  static_cast<void>(natsConnection_PublishRequest(connection_.get(), subject.c_str(),
                                                  (inbox_ + kAsk + "." + what).c_str(), request.data(),
                                                  static_cast<int>(request.size())));
}

natsStatus NatsLog::publish(const Item& item) {
  const LogMessage& content = *item.message;
  const bool isDead = item.token == 0;
  const uint32_t partition = partitionOf(content.id, settings_.partitions);
  const std::string subject = isDead ? kDeadSubject : eventSubject(std::to_string(partition));
  const std::string reply =
      inbox_ + (isDead ? kDead : std::to_string(partition % groups())) + "." + std::to_string(item.token);
  natsMsg* message = nullptr;
  natsStatus status = natsMsg_Create(&message, subject.c_str(), reply.c_str(), content.body.data(),
                                     static_cast<int>(content.body.size()));
  const Owned<natsMsg> owned(message);
  if (status == NATS_OK && !isDead) status = natsMsgHeader_Set(message, "Nats-Msg-Id", content.id.c_str());
  for (const auto& [name, value] : content.headers)
    if (status == NATS_OK) status = natsMsgHeader_Set(message, name.c_str(), value.c_str());
  return status == NATS_OK ? NatsSocket::publish(connection_.get(), message) : status;
}

void NatsLog::write(const Item& item) {
  const bool isDead = item.token == 0;
  if (isDead) ++deadInFlight_;
  // The library would keep it for when it is connected again; the spool does that better.
  const natsStatus status = isConnected_ ? publish(item) : NATS_CONNECTION_DISCONNECTED;
  if (status == NATS_OK) return;
  if (isDead) return endDeadLetter(false);
  const auto verdict = status == NATS_MAX_PAYLOAD ? LogVerdict::refusedForGood : LogVerdict::refused;
  listener_->logAnswered(item.token, {verdict, textOf(status)});
}

StreamsMade NatsLog::makeStreams(bool updates) {
  if (!connect()) return {"cannot connect: " + toldProblem_, {}};
  jsCtx* context = nullptr;
  const natsStatus status = natsConnection_JetStream(&context, connection_.get(), nullptr);
  const Owned<jsCtx> owned(context);
  if (status != NATS_OK) return {textOf(status), {}};
  return receiver::makeStreams(context, settings_, updates);
}

}  // namespace kyt::receiver
