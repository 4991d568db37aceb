#include "platform/ipc/DBusConnection.h"

#include <cstdio>
#include <cstring>
#include <utility>

#include "platform/Entitlements.h"
#include "platform/base/Clock.h"
#include "platform/base/Limits.h"
#include "platform/queues/LineLimits.h"
#include "platform/queues/Log.h"

namespace kyt {

DBusConnection::DBusConnection(std::shared_ptr<ServerContext> context, std::unique_ptr<Stream> stream,
                               PeerCredentials peer, std::shared_ptr<UserAccount> account, uint64_t number)
    : context_(std::move(context)),
      number_(number),
      user_(peer.uid),
      process_(peer.pid),
      descriptor_(stream->descriptor()),
      account_(std::move(account)),
      queue_(SerialQueue::create("kyt.connection", context_->services.executor, uint64_t{peer.uid} + 1)),
      peer_(std::make_unique<PeerCredentials>(std::move(peer))),
      stream_(std::move(stream)),
      keptCharge_(account_, Share::bytes),
      descriptorsCharge_(account_, Share::descriptors) {}

DBusConnection::~DBusConnection() = default;

void DBusConnection::offer(Listener& listener, ListenerDelegate& delegate) {
  const std::shared_ptr<ConnectionOutput::Observer> observer(shared_from_this(), this);
  queue_->sync([&] {
    queue_->assertCurrent();
    output_ = std::make_shared<ConnectionOutput>(*stream_, observer, context_->services.limits.maxQueuedBytes,
                                                 account_);
  });
  queue_->async([self = shared_from_this(), &listener, &delegate] {
    self->queue_->assertCurrent();
    if (self->ended_ || self->closed()) return;
    const bool accepted = delegate.listenerShouldAcceptNewConnection(listener, self);
    self->peer_.reset();
    if (!accepted) self->countRefusal();
    if (accepted && self->resumed_ && self->exportedObject_) {
      self->start();
    } else {
      self->end(false, false);
    }
  });
}

// Who lacks what was asked for is told nothing; who comes to a daemon that ends may come again.
void DBusConnection::countRefusal() {
  context_->services.counters.add(refused_ ? Reason::unentitledConnection : Reason::connectionAtTheEnd);
  if (!refused_) output_->sendHandshake(kServerEnds);
}

void DBusConnection::start() {
  started_ = true;
  handshake_ = std::make_unique<ServerHandshake>(user_, context_->services.machineId);
  const auto patience =
      std::chrono::duration_cast<Duration>(std::chrono::duration<double>(Limits::handshakeSeconds));
  handshakeTimer_ = context_->services.timers.after(patience, queue_, [weak = weak_from_this()] {
    const auto self = weak.lock();
    if (self == nullptr) return;
    self->queue_->assertCurrent();
    self->handshakeTookTooLong();
  });
  armRead();
}

void DBusConnection::handshakeTookTooLong() {
  if (!handshake_ || ended_) return;
  const ClientScope scope(user_);
  breakOff(Reason::handshakeTimedOut, "the handshake took too long");
  end(true, false);
}

Value DBusConnection::entitlementValue(std::string_view key) {
  queue_->assertCurrent();
  Value value = peer_ ? context_->services.entitlements.valueFor(*peer_, key) : Value();
  refused_ = !value.boolValue();
  return value;
}

std::string DBusConnection::description() const {
  queue_->assertCurrent();
  return descriptionOnQueue();
}

std::string DBusConnection::descriptionOnQueue() const {
  char text[96];
  std::snprintf(text, sizeof text, "%llu of process %d, user %u", static_cast<unsigned long long>(number_),
                process_, user_);
  std::string line = text;
  // More is worth asking for only where somebody reads the line about a refusal, which has this description.
  if (!refused_ || peer_ == nullptr || !context_->services.log.debugEnabled()) return line;
  const std::string executable = context_->services.entitlements.executableOf(*peer_);
  if (!executable.empty()) line.append(" (").append(executable).append(")");
  line.append(", see \"kytctl entitlements check --pid ").append(std::to_string(process_)).append("\",");
  return line;
}

void DBusConnection::setExportedObject(std::shared_ptr<ClientSessionInterface> object) {
  queue_->assertCurrent();
  exportedObject_ = std::move(object);
}

void DBusConnection::setInterruptionHandler(Task handler) {
  queue_->assertCurrent();
  interruptionHandler_ = std::move(handler);
}

void DBusConnection::setInvalidationHandler(Task handler) {
  queue_->assertCurrent();
  invalidationHandler_ = std::move(handler);
}

void DBusConnection::resume() {
  queue_->assertCurrent();
  resumed_ = true;
}

void DBusConnection::invalidate() {
  hurried_ = true;
  if (!invalidating_.exchange(true)) endLater(false);
  scheduleTurn();  // closes a connection that has ended and only waits to be written
}

void DBusConnection::finish() {
  if (finishing_.exchange(true)) return;
  scheduleTurn();
}

void DBusConnection::abandon() {
  invalidating_ = true;
  Watch watch;
  {
    MutexLock lock(watchMutex_);
    closed_ = true;
    watch = std::move(watch_);
  }
  watch.cancel();
  output_->close();
  context_->remove(number_, *account_);
}

// Reports the one problem that ends the connection.
DBusConnection::Step DBusConnection::breakOff(Reason reason, const char* problem) {
  context_->services.counters.add(reason);
  context_->services.log.normal("DBusConnection(end): connection %s: %s", descriptionOnQueue().c_str(),
                                problem);
  return Step::broken;
}

void DBusConnection::endLater(bool broken) {
  queue_->async([self = shared_from_this(), broken] {
    self->queue_->assertCurrent();
    self->end(broken, false);
  });
}

// The second call does nothing.
void DBusConnection::end(bool broken, bool waitForOutput) {
  if (closed() || std::exchange(ended_, true)) return;
  const ClientScope scope(user_);
  invalidating_ = true;
  handshakeTimer_.cancel();
  messageTimer_.cancel();
  if (handshake_ && finishing_) output_->sendHandshake(kServerEnds);
  if (started_) {
    Task interruption = std::move(interruptionHandler_), invalidation = std::move(invalidationHandler_);
    if (broken && interruption) interruption();
    if (invalidation) invalidation();
  }
  interruptionHandler_.reset();
  invalidationHandler_.reset();
  exportedObject_.reset();
  handshake_.reset();
  descriptors_.clear();
  descriptorsCharge_.clear();
  kept_ = std::string();
  keptCharge_.clear();
  // What the turn's deferred work still answers leaves with the rest.
  if (Turn* turn = Turn::current()) turn->runDeferred();
  if (output_->finish() || !waitForOutput) closeStream();
}

void DBusConnection::closeStream() {
  Watch watch;
  {
    MutexLock lock(watchMutex_);
    if (closed_.exchange(true)) return;
    watch = std::move(watch_);
  }
  watch.cancel();
  output_->close();
  stream_.reset();
  context_->remove(number_, *account_);
}

void DBusConnection::scheduleTurn() {
  if (turnScheduled_.exchange(true)) return;
  queue_->async([self = shared_from_this()] {
    self->queue_->assertCurrent();
    self->turn();
  });
}

void DBusConnection::armRead() {
  armWatch(ready::readable);
}

// Asks the reactor for one report, of this and of what is asked for already.
void DBusConnection::armWatch(unsigned events) {
  MutexLock lock(watchMutex_);
  if (closed_) return;
  const unsigned armed = armed_.fetch_or(events);
  if ((armed & events) == events) return;
  const unsigned wanted = armed | events | ready::oneShot;
  if (watch_) {
    if (watch_.modify(wanted)) return;
  } else {
    watch_ =
        context_->services.reactor.watch(descriptor_, wanted, [weak = weak_from_this()](unsigned happened) {
          if (const auto self = weak.lock()) self->handleReady(happened);
        });
    if (watch_) return;
  }
  context_->services.log.error("DBusConnection(armWatch): the system refuses to watch connection %llu",
                               static_cast<unsigned long long>(number_));
  invalidating_ = true;
  endLater(true);
}

// On the reactor's thread.
void DBusConnection::handleReady(unsigned events) {
  const bool gone = (events & (ready::ended | ready::failed)) != 0;
  if (closed_) return;
  const unsigned armed = armed_.exchange(0);
  const unsigned again = gone ? 0 : armed & ~events;
  // A client that has ended its side is read to the end and then ended, even if it takes no more replies: the
  // turn sees to all of it, and nothing is asked of the reactor here that it would report again at once.
  if (gone) peerGone_ = true;
  if ((events & ready::writable) != 0) output_->writable();
  if (gone || (events & ready::readable) != 0) scheduleTurn();
  if (again != 0) armWatch(again);
}

void DBusConnection::outputNeedsRoom() {
  armWatch(ready::writable);
}

void DBusConnection::outputPaused() {
  if (context_->services.counters.addAndMayLog(Reason::queuedBytesExceeded,
                                               context_->services.clock.monotonic())) {
    context_->services.log.normal(
        "DBusConnection(outputPaused): connection %llu of user %u does not read its replies",
        static_cast<unsigned long long>(number_), user_);
  }
}

void DBusConnection::outputDrained() {
  scheduleTurn();
}

void DBusConnection::outputOverflowed() {
  if (context_->services.counters.addAndMayLog(Reason::clientNotReading,
                                               context_->services.clock.monotonic())) {
    context_->services.log.normal(
        "DBusConnection(outputOverflowed): connection %llu of user %u ends, it reads nothing",
        static_cast<unsigned long long>(number_), user_);
  }
  invalidate();
}

void DBusConnection::outputBroken() {
  if (invalidating_.exchange(true)) {
    scheduleTurn();  // a connection that waits to be written ends now
    return;
  }
  endLater(true);
}

std::optional<Error> DBusConnection::sendMessageToClient(std::optional<Dictionary> sessionInfo,
                                                         double timestamp, uint16_t category, uint16_t type,
                                                         std::optional<Dictionary> payload) {
  // The end of an aggregation. A client that missed it would wait for messages for ever. There is at most one for
  // each time that the client asks for aggregation, and while its output is full it is not heard.
  const bool isEnd = !sessionInfo && timestamp == 0 && category == 0 && type == 0 && !payload;
  const auto sent = output_->send(
      [&](MessageWriter& out, uint32_t serial) {
        out.beginCall(serial, {.path = wire::kClientPath,
                               .interface = wire::kReplyInterface,
                               .member = "SendMessageToClient",
                               .signature = "aa{sv}dqqaa{sv}",
                               .expectsReply = false});
        out.writeOptionalDictionary(sessionInfo);
        out.writeDouble(timestamp);
        out.writeUInt16(category);
        out.writeUInt16(type);
        out.writeOptionalDictionary(payload);
        return out.end();
      },
      isEnd ? ConnectionOutput::Kind::vital : ConnectionOutput::Kind::droppable);
  switch (sent) {
    case ConnectionOutput::Sent::yes:
      return std::nullopt;
    case ConnectionOutput::Sent::queueFull:
      if (context_->services.counters.addAndMayLog(Reason::aggregatorMessageDropped,
                                                   context_->services.clock.monotonic())) {
        context_->services.log.normal(
            "DBusConnection(sendMessageToClient): message dropped, connection %llu of user %u reads too slowly",
            static_cast<unsigned long long>(number_), user_);
      }
      return std::nullopt;
    case ConnectionOutput::Sent::refused:
    case ConnectionOutput::Sent::closed:
      break;
  }
  // Nobody misses the end of an aggregation when its client is gone.
  if (!isEnd) context_->services.counters.add(Reason::aggregatorMessageDropped);
  if (sent == ConnectionOutput::Sent::refused)
    return Error{"KYTReportingErrorDomain", -1, "The message is too large or nested too deeply"};
  return Error{"KYTReportingErrorDomain", -1, "The connection was invalidated"};
}

}  // namespace kyt
