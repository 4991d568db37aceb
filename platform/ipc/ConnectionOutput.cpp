#include "platform/ipc/ConnectionOutput.h"

#include <utility>

#include "platform/base/Limits.h"

namespace kyt {
namespace {

constexpr size_t kMostHeldBytes = 65536;  // a turn's replies beyond that do not wait for its end

}  // namespace

ConnectionOutput::Sent ConnectionOutput::send(Builder build, Kind kind) {
  Event event = Event::none;
  {
    MutexLock lock(mutex_);
    if (stream_ == nullptr || dead_) return Sent::closed;
    std::string& queue = open_ ? pending_ : early_;
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
    event = queued(kind);
  }
  tell(event);
  return Sent::yes;
}

void ConnectionOutput::sendHandshake(std::string_view bytes) {
  Event event = Event::none;
  {
    MutexLock lock(mutex_);
    if (stream_ == nullptr || dead_) return;
    pending_.append(bytes);
    event = queued();
  }
  tell(event);
}

void ConnectionOutput::open() {
  Event event = Event::none;
  {
    MutexLock lock(mutex_);
    open_ = true;
    if (stream_ == nullptr || dead_ || early_.empty()) return;
    pending_.append(std::exchange(early_, std::string()));
    event = queued();
  }
  tell(event);
}

ConnectionOutput::Event ConnectionOutput::queued(Kind kind) {
  Event event = Event::none;
  const bool mayHold = held_ && waitingBytes() < kMostHeldBytes && waitingBytes() <= maxQueuedBytes_;
  if (!waiting_ && !mayHold) event = flush();
  const size_t left = waitingBytes();
  countWaiting();
  const bool mayEnd = event != Event::broken && kind != Kind::vital;
  if (mayEnd && (left > 2 * maxQueuedBytes_ || fillsItsUsersShare())) {
    discard();
    return Event::overflowed;
  }
  if (event == Event::broken || left <= maxQueuedBytes_) return event;
  if (paused_) return event;
  paused_ = true;
  return event == Event::needsRoom ? Event::pausedAndNeedsRoom : Event::paused;
}

// While the socket takes what is written, little waits, and not for long: that is counted with the connection.
void ConnectionOutput::countWaiting() {
  charge_.setAnyway(waiting_ ? waitingBytes() + Limits::socketBytes : 0);
}

// Nothing is sent any more.
void ConnectionOutput::discard() {
  dead_ = true;
  pending_ = std::string();
  written_ = 0;
  charge_.clear();
}

ConnectionOutput::Event ConnectionOutput::flush() {
  while (written_ < pending_.size()) {
    const StreamResult result = stream_->write(std::string_view(pending_).substr(written_));
    if (result.status == StreamStatus::wouldBlock) {
      if (written_ > pending_.size() / 2) {
        pending_.erase(0, written_);
        written_ = 0;
      }
      const bool mayGoOn = paused_ && pending_.size() - written_ <= maxQueuedBytes_ / 2;
      if (mayGoOn) paused_ = false;
      waiting_ = true;
      countWaiting();
      return mayGoOn ? Event::drainedAndNeedsRoom : Event::needsRoom;
    }
    if (result.status != StreamStatus::ok) {
      discard();
      return Event::broken;
    }
    written_ += result.bytes;
  }
  pending_ = std::string();  // an idle connection holds no buffer
  written_ = 0;
  const bool tellDrained = paused_.exchange(false) || (finishing_ && waiting_);
  waiting_ = false;
  countWaiting();
  return tellDrained ? Event::drained : Event::none;
}

void ConnectionOutput::tell(Event event) {
  if (event == Event::none) return;
  const std::shared_ptr<Observer> observer = observer_.lock();
  if (!observer) return;
  switch (event) {
    case Event::none:
      break;
    case Event::needsRoom:
      observer->outputNeedsRoom();
      break;
    case Event::pausedAndNeedsRoom:
      observer->outputPaused();
      observer->outputNeedsRoom();
      break;
    case Event::paused:
      observer->outputPaused();
      break;
    case Event::drainedAndNeedsRoom:
      observer->outputDrained();
      observer->outputNeedsRoom();
      break;
    case Event::drained:
      observer->outputDrained();
      break;
    case Event::overflowed:
      observer->outputOverflowed();
      break;
    case Event::broken:
      observer->outputBroken();
      break;
  }
}

void ConnectionOutput::hold() {
  MutexLock lock(mutex_);
  held_ = true;
}

void ConnectionOutput::release() {
  Event event = Event::none;
  {
    MutexLock lock(mutex_);
    held_ = false;
    if (stream_ != nullptr && !dead_ && !waiting_) event = flush();
  }
  tell(event);
}

void ConnectionOutput::writable() {
  Event event = Event::none;
  {
    MutexLock lock(mutex_);
    if (stream_ != nullptr && !dead_ && waiting_) event = flush();
  }
  tell(event);
}

bool ConnectionOutput::finish() {
  Event event = Event::none;
  bool written = false;
  {
    MutexLock lock(mutex_);
    finishing_ = true;
    held_ = false;
    if (stream_ != nullptr && !dead_ && !waiting_) event = flush();
    written = stream_ == nullptr || dead_ || pending_.empty();
  }
  if (!written) tell(event);
  return written;
}

void ConnectionOutput::close() {
  MutexLock lock(mutex_);
  stream_ = nullptr;
  discard();
}

}  // namespace kyt
