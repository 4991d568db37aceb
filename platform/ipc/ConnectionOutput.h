// What the daemon sends on one connection: replies and one-way calls, queued under a lock of its own and
// written by whoever queued them or, when the socket had no room, by the reactor.
//
// A turn of the connection gathers its replies (hold() … release()), so that they leave in one write; they
// leave earlier when the turn is about to block. What waits is limited: past `maxQueuedBytes` the connection
// stops reading from its client until half of it is gone; past twice that it ends. It also ends when its client does not
// read while all that is kept for the clients of its user is more than their share. Callable from any thread; never
// blocks.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <string>

#include "platform/Stream.h"
#include "platform/base/Function.h"
#include "platform/base/Mutex.h"
#include "platform/base/UserBudget.h"
#include "platform/ipc/MessageWriter.h"
#include "platform/ipc/OutgoingBytes.h"

namespace kyt {

class ConnectionOutput {
 public:
  // What the connection is told; called without the lock, from whatever thread the change happened on.
  class Observer {
   public:
    virtual ~Observer() = default;
    virtual void outputNeedsRoom() = 0;   // tell the output (writable()) when the socket takes bytes again
    virtual void outputPaused() = 0;      // past the limit: reading stops
    virtual void outputDrained() = 0;     // reading may go on; after finish(): everything is written
    virtual void outputOverflowed() = 0;  // past twice the limit: the connection ends
    virtual void outputBroken() = 0;      // the socket is broken
  };

  // `stream` is used until close().
  ConnectionOutput(Stream& stream, uint64_t maxQueuedBytes, const std::shared_ptr<UserAccount>& account)
      : stream_(&stream),
        maxQueuedBytes_(maxQueuedBytes),
        account_(account),
        charge_(account, Share::bytes) {}
  // Once, before anything is sent.
  void setObserver(std::weak_ptr<Observer> observer) { observer_ = std::move(observer); }

  enum class Kind : uint8_t {
    ordinary,
    droppable,  // not sent where it would pass the limit
    bounded,    // not sent where it would end the connection, so that its caller can say so instead
    optional,  // not sent while anything waits for the socket: a client that does not read costs one such message
    vital,  // sent past every limit, and never the reason why the connection ends: the caller sees to it that
            // such messages are few
  };
  using Builder = Function<bool(MessageWriter&, uint32_t serial)>;
  enum class Sent : uint8_t {
    yes,
    closed,   // nobody is there any more
    refused,  // it cannot be written as a message: too long, or nested too deeply
    queueFull,  // it is droppable and would have passed the limit, bounded and the end of the connection, or optional and
                // would have had to wait
  };
  // Writes one whole message.
  Sent send(Builder build, Kind kind = Kind::ordinary);
  // The handshake's answers, which go before every message: a message that is sent earlier waits for open().
  void sendHandshake(std::string_view bytes);
  void open();

  void hold();
  void release();  // and writes
  void writable();
  [[nodiscard]] bool paused() const {
    return paused_.load(std::memory_order_relaxed);
  }  // asked after every call
  // Whether everything is written; otherwise outputDrained() follows when it is, or outputBroken().
  [[nodiscard]] bool finish();
  // The stream is not touched any more when this returns.
  void close();

 private:
  // What the observer is to be told once the mutex is free, in this order. What breaks off stands alone.
  struct News {
    bool overflowed = false;
    bool broken = false;
    bool paused = false;
    bool drained = false;
    bool needsRoom = false;
  };
  News flush() REQUIRES(mutex_);
  News queued(Kind kind = Kind::ordinary) REQUIRES(mutex_);
  [[nodiscard]] size_t waitingBytes() const REQUIRES(mutex_) { return pending_.size() + early_.size(); }
  void countWaiting() REQUIRES(mutex_);
  [[nodiscard]] bool fillsItsUsersShare() const REQUIRES(mutex_) {
    return waiting_ && account_ != nullptr && account_->isOver(Share::bytes);
  }
  // Whether what waits now would end the connection if the socket took nothing of the last message.
  [[nodiscard]] bool wouldEnd(size_t lastMessageBytes) REQUIRES(mutex_);
  void discard() REQUIRES(mutex_);
  void tell(const News& news);

  mutable Mutex mutex_;
  Stream* stream_ GUARDED_BY(mutex_);
  std::weak_ptr<Observer> observer_;  // constant once anything is sent
  const uint64_t maxQueuedBytes_;
  const std::shared_ptr<UserAccount> account_;
  Charge charge_ GUARDED_BY(mutex_);  // for what waits while the socket is full, its own buffer included
  OutgoingBytes pending_ GUARDED_BY(mutex_);
  std::string early_ GUARDED_BY(mutex_);  // messages that wait for the handshake's end
  bool open_ GUARDED_BY(mutex_) = false;
  uint32_t lastSerial_ GUARDED_BY(mutex_) = 0;
  bool held_ GUARDED_BY(mutex_) = false;
  bool waiting_ GUARDED_BY(mutex_) = false;  // for room
  std::atomic<bool> paused_{false};          // changes under the mutex
  bool finishing_ GUARDED_BY(mutex_) = false;
  bool dead_ GUARDED_BY(mutex_) = false;  // broken or overflowed: nothing is sent any more
};

}  // namespace kyt
