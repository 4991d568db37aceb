#include "platform/ipc/DBusConnection.h"

#include <cstdio>
#include <utility>

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
      account_(std::move(account)),
      queue_(SerialQueue::create("kyt.connection", context_->services.executor, uint64_t{peer.uid} + 1)),
      output_(
          std::make_shared<ConnectionOutput>(*stream, context_->services.limits.maxQueuedBytes, account_)),
      client_(context_->services, *output_, number_, user_),
      watch_(context_->services.reactor, stream->descriptor()),
      admission_(std::make_unique<Admission>(context_->services.entitlements, std::move(peer))),
      stream_(std::move(stream)),
      kept_(account_),
      descriptors_(account_),
      patience_(context_->services.timers) {}

// What is asked of a connection that was found in the table comes behind the decision.
void DBusConnection::offer(Listener& listener, ListenerDelegate& delegate) {
  const std::shared_ptr<DBusConnection> self = shared_from_this();
  output_->setObserver(std::shared_ptr<ConnectionOutput::Observer>(self, this));
  queue_->sync([&] {
    queue_->async([self, &listener, &delegate] {
      self->queue_->assertCurrent();
      self->decide(listener, delegate);
    });
    context_->enlist(number_, self);
  });
}

// Who lacks what was asked for is told nothing; who comes to a daemon that ends may come again.
void DBusConnection::decide(Listener& listener, ListenerDelegate& delegate) {
  if (life_.reached(Life::ended)) return;
  const bool accepted = delegate.listenerShouldAcceptNewConnection(listener, shared_from_this());
  const std::unique_ptr<Admission> admission = std::move(admission_);
  if (accepted && admission->resumed() && exportedObject_) return start();
  if (!accepted) {
    const bool refused = admission->refused();
    context_->services.counters.add(refused ? Reason::unentitledConnection : Reason::connectionAtTheEnd);
    if (!refused) output_->sendHandshake(kServerEnds);
  }
  interruptionHandler_.reset();
  invalidationHandler_.reset();
  end(Step::ended);
}

void DBusConnection::start() {
  life_.advance(Life::shakingHands);
  handshake_ = std::make_unique<ServerHandshake>(user_, context_->services.machineId);
  handshakeTimer_ = context_->services.timers.after(Limits::handshakeTime, queue_, [weak = weak_from_this()] {
    const auto self = weak.lock();
    if (self == nullptr) return;
    self->queue_->assertCurrent();
    self->handshakeTookTooLong();
  });
  armWatch(ready::readable);
}

void DBusConnection::handshakeTookTooLong() {
  if (!handshake_ || life_.reached(Life::ended)) return;
  const ClientScope scope(user_);
  breakOff(Reason::handshakeTimedOut, "the handshake took too long");
  end(Step::broken);
}

Value DBusConnection::entitlementValue(std::string_view key) {
  queue_->assertCurrent();
  return admission_ ? admission_->entitlementValue(key) : Value();
}

std::string DBusConnection::description() const {
  queue_->assertCurrent();
  char text[96];
  std::snprintf(text, sizeof text, "%llu of process %d, user %u", static_cast<unsigned long long>(number_),
                process_, user_);
  std::string line = text;
  // More is worth asking for only where somebody reads the line about a refusal, which has this description.
  if (admission_ && admission_->refused() && context_->services.log.debugEnabled())
    line += admission_->advice();
  return line;
}

bool DBusConnection::isPeerInGroup(uint32_t group) const {
  queue_->assertCurrent();
  return admission_ && admission_->isInGroup(group);
}

void DBusConnection::setExportedObject(std::shared_ptr<ExportedObject> object) {
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
  if (admission_) admission_->resume();
}

void DBusConnection::invalidate() {
  hurried_ = true;
  if (life_.advance(Life::stopping)) endLater(Step::stopped);
  scheduleTurn();  // closes a connection that has ended and only waits to be written
}

void DBusConnection::finish() {
  if (life_.advance(Life::finishing)) scheduleTurn();
}

bool DBusConnection::abandon() {
  if (!life_.advance(Life::closed)) return false;
  watch_.close();
  output_->close();
  context_->remove(number_, *account_);
  return true;
}

// Reports the one problem that ends the connection.
DBusConnection::Step DBusConnection::breakOff(Reason reason, const char* problem) {
  context_->services.counters.add(reason);
  context_->services.log.normal("DBusConnection(end): connection %s: %s", description().c_str(), problem);
  return Step::broken;
}

void DBusConnection::endLater(Step how) {
  queue_->async([self = shared_from_this(), how] {
    self->queue_->assertCurrent();
    self->end(how);
  });
}

// The second call does nothing. A connection that finishes waits until its output is written.
void DBusConnection::end(Step how) {
  const std::optional<Life> before = life_.advance(Life::ended);
  if (!before) return;
  const ClientScope scope(user_);
  const LineOrder::Scope lines(lines_);
  handshakeTimer_.cancel();
  patience_.end();
  if (handshake_ && how == Step::stopped) output_->sendHandshake(kServerEnds);
  Task interruption = std::move(interruptionHandler_), invalidation = std::move(invalidationHandler_);
  if (how == Step::broken && interruption) interruption();
  if (invalidation) invalidation();
  interruption.reset();
  invalidation.reset();
  exportedObject_.reset();
  handshake_.reset();
  descriptors_.clear();
  kept_.clear();
  // What the turn's deferred work still answers leaves with the rest.
  if (Turn* turn = Turn::current()) turn->runDeferred();
  const bool waits = how == Step::stopped && before == Life::finishing;
  if (output_->finish() || !waits) closeStream();
}

void DBusConnection::closeStream() {
  if (abandon()) stream_.reset();
}

void DBusConnection::scheduleTurn() {
  if (turnScheduled_.exchange(true)) return;
  queue_->async([self = shared_from_this()] {
    self->queue_->assertCurrent();
    self->turn();
  });
}

void DBusConnection::armWatch(unsigned events) {
  const bool watched = watch_.arm(events, [this] {
    return [weak = weak_from_this()](unsigned happened) {
      if (const auto self = weak.lock()) self->handleReady(happened);
    };
  });
  if (watched) return;
  context_->services.log.error("DBusConnection(armWatch): the system refuses to watch connection %llu",
                               static_cast<unsigned long long>(number_));
  life_.advance(Life::stopping);
  endLater(Step::broken);
}

// On the reactor's thread.
void DBusConnection::handleReady(unsigned events) {
  if (life_.reached(Life::closed)) return;
  const bool gone = (events & (ready::ended | ready::failed)) != 0;
  const unsigned again = watch_.reported(events);
  // A client that has ended its side is read to the end and then ended, even if it takes no more replies: the
  // turn sees to all of it, and nothing is asked of the reactor here that it would report again at once.
  if (gone) hurried_ = true;
  if ((events & ready::writable) != 0) output_->writable();
  if (gone || (events & ready::readable) != 0) scheduleTurn();
  if (!gone && again != 0) armWatch(again);
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
  if (life_.advance(Life::stopping)) return endLater(Step::broken);
  scheduleTurn();  // a connection that waits to be written ends now
}

}  // namespace kyt
