#include "platform/ipc/ConnectionOutput.h"

#include <utility>

#include "platform/base/Limits.h"

namespace kyt {
namespace {

constexpr size_t kMostHeldBytes = 65536;  // a turn's replies beyond that do not wait for its end

}  // namespace

ConnectionOutput::Sent ConnectionOutput::send(Builder build, Kind kind) {
  News news;
  {
    MutexLock lock(mutex_);
    if (stream_ == nullptr || dead_) return Sent::closed;
    if (kind == Kind::optional && waiting_) return Sent::queueFull;
    std::string& queue = open_ ? pending_.end() : early_;
    const size_t before = queue.size();
    if (++lastSerial_ == 0) ++lastSerial_;
    MessageWriter writer(queue);
    if (!build(writer, lastSerial_)) return Sent::refused;
    const bool droppable = kind == Kind::droppable;
    if (droppable) countWaiting();
    if (droppable && (waitingBytes() > maxQueuedBytes_ || fillsItsUsersShare())) {
      queue.resize(before);
      countWaiting();
      return Sent::queueFull;
    }
    if (kind == Kind::bounded && wouldEnd(queue.size() - before)) {
      queue.resize(before);
      return Sent::queueFull;
    }
    news = queued(kind);
  }
  tell(news);
  return Sent::yes;
}

void ConnectionOutput::sendHandshake(std::string_view bytes) {
  News news;
  {
    MutexLock lock(mutex_);
    if (stream_ == nullptr || dead_) return;
    pending_.end().append(bytes);
    news = queued();
  }
  tell(news);
}

void ConnectionOutput::open() {
  News news;
  {
    MutexLock lock(mutex_);
    open_ = true;
    if (stream_ == nullptr || dead_ || early_.empty()) return;
    pending_.end().append(std::exchange(early_, std::string()));
    news = queued();
  }
  tell(news);
}

ConnectionOutput::News ConnectionOutput::queued(Kind kind) {
  News news;
  const bool mayHold = held_ && waitingBytes() < kMostHeldBytes && waitingBytes() <= maxQueuedBytes_;
  if (!waiting_ && !mayHold) news = flush();
  const size_t left = waitingBytes();
  countWaiting();
  const bool mayEnd = !news.broken && kind != Kind::vital;
  if (mayEnd && (left > 2 * maxQueuedBytes_ || fillsItsUsersShare())) {
    discard();
    return {.overflowed = true};
  }
  news.paused = !news.broken && left > maxQueuedBytes_ && !paused_.exchange(true);
  return news;
}

// A socket without anything in it takes what is small: only of what is larger some waits, and is counted.
bool ConnectionOutput::wouldEnd(size_t lastMessageBytes) {
  if (waitingBytes() > 2 * maxQueuedBytes_) return true;
  if (account_ == nullptr || (!waiting_ && lastMessageBytes <= kMostHeldBytes)) return false;
  charge_.setAnyway(waitingBytes() + Limits::socketBytes);
  const bool isOver = account_->isOver(Share::bytes);
  countWaiting();
  return isOver;
}

// While the socket takes what is written, little waits, and not for long: that is counted with the connection.
void ConnectionOutput::countWaiting() {
  charge_.setAnyway(waiting_ ? waitingBytes() + Limits::socketBytes : 0);
}

// Nothing is sent any more.
void ConnectionOutput::discard() {
  dead_ = true;
  pending_.clear();
  charge_.clear();
}

ConnectionOutput::News ConnectionOutput::flush() {
  const bool hadAny = !pending_.empty();
  while (!pending_.empty()) {
    const StreamResult result = stream_->write(pending_.front());
    if (result.status == StreamStatus::wouldBlock) {
      const bool mayGoOn = paused_ && pending_.size() <= maxQueuedBytes_ / 2;
      if (mayGoOn) paused_ = false;
      waiting_ = true;
      countWaiting();
      return {.drained = mayGoOn, .needsRoom = true};
    }
    if (result.status != StreamStatus::ok) {
      discard();
      return {.broken = true};
    }
    pending_.remove(result.bytes);
  }
  if (hadAny) pending_.clear();  // an idle connection holds no buffer
  const bool tellDrained = paused_.exchange(false) || (finishing_ && waiting_);
  waiting_ = false;
  countWaiting();
  return {.drained = tellDrained};
}

void ConnectionOutput::tell(const News& news) {
  if (!(news.overflowed || news.broken || news.paused || news.drained || news.needsRoom)) return;
  const std::shared_ptr<Observer> observer = observer_.lock();
  if (!observer) return;
  if (news.overflowed) observer->outputOverflowed();
  if (news.broken) observer->outputBroken();
  if (news.paused) observer->outputPaused();
  if (news.drained) observer->outputDrained();
  if (news.needsRoom) observer->outputNeedsRoom();
}

void ConnectionOutput::hold() {
  MutexLock lock(mutex_);
  held_ = true;
}

void ConnectionOutput::release() {
  News news;
  {
    MutexLock lock(mutex_);
    held_ = false;
    if (stream_ != nullptr && !dead_ && !waiting_) news = flush();
  }
  tell(news);
}

void ConnectionOutput::writable() {
  News news;
  {
    MutexLock lock(mutex_);
    if (stream_ != nullptr && !dead_ && waiting_) news = flush();
  }
  tell(news);
}

bool ConnectionOutput::finish() {
  News news;
  bool written = false;
  {
    MutexLock lock(mutex_);
    finishing_ = true;
    held_ = false;
    if (stream_ != nullptr && !dead_ && !waiting_) news = flush();
    written = stream_ == nullptr || dead_ || pending_.empty();
  }
  if (!written) tell(news);
  return written;
}

void ConnectionOutput::close() {
  MutexLock lock(mutex_);
  stream_ = nullptr;
  discard();
}

}  // namespace kyt
