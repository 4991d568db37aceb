#include "platform/ipc/DBusServer.h"

#include <atomic>
#include <utility>

#include "platform/base/Clock.h"
#include "platform/base/Counters.h"
#include "platform/base/UserBudget.h"
#include "platform/ipc/DBusConnection.h"
#include "platform/queues/Log.h"
#include "platform/queues/SerialQueue.h"

namespace kyt {
namespace {

constexpr unsigned kAcceptsPerTurn = 64;
constexpr Duration kExhaustedPause = std::chrono::milliseconds(100);
constexpr Duration kFailedPause = std::chrono::seconds(1);  // after what should not happen

}  // namespace

// The accepting half: lives on its own queue.
class DBusServer::Acceptance : public std::enable_shared_from_this<Acceptance> {
 public:
  Acceptance(std::shared_ptr<ServerContext> context, std::unique_ptr<StreamAcceptor> acceptor,
             Listener& listener)
      : context_(std::move(context)),
        acceptor_(std::move(acceptor)),
        listener_(listener),
        queue_(SerialQueue::create("kyt.listener", context_->services.executor)) {}

  void start(ListenerDelegate& delegate) {
    delegate_ = &delegate;
    MutexLock lock(mutex_);
    if (stopped_) return;
    accepting_ = true;
    watchLocked();
    if (!watch_) waitBeforeNextLocked("the system refuses to watch the socket");
  }

  // Nothing is accepted any more when this returns, except by a turn that has begun.
  void stop() {
    Watch watch;
    {
      MutexLock lock(mutex_);
      stopped_ = true;
      accepting_ = false;
      watch = std::move(watch_);
    }
  }

  // What the watch reports meanwhile is not lost: it is looked for at the resumption.
  void pause() {
    MutexLock lock(mutex_);
    accepting_ = false;
  }
  void resume() {
    {
      MutexLock lock(mutex_);
      if (stopped_) return;
      accepting_ = true;
    }
    queue_->async([self = shared_from_this()] { self->acceptWhatCame(); });
  }

  // The queue's work is done and none comes: what it refers to may go. Not from the queue.
  void wait() {
    queue_->sync([] {});
  }

 private:
  bool accepting() {
    MutexLock lock(mutex_);
    return accepting_;
  }

  // The queue's work.
  void acceptWhatCame() {
    queue_->assertCurrent();
    acceptSome();
  }

  void acceptSome() REQUIRES(*queue_) {
    for (unsigned i = 0; i < kAcceptsPerTurn && accepting(); ++i) {
      std::unique_ptr<Stream> stream;
      switch (acceptor_->accept(stream)) {
        case AcceptStatus::accepted:
          take(std::move(stream));
          break;
        case AcceptStatus::retry:
          break;
        case AcceptStatus::wouldBlock:
          return rearm();
        case AcceptStatus::exhausted:
          return waitForDescriptors();
        case AcceptStatus::failed:
          return waitBeforeNext("the listening socket failed");
      }
    }
    rearm();
  }

  void watchLocked() REQUIRES(mutex_) {
    watch_ = context_->services.reactor.watch(acceptor_->descriptor(), ready::readable | ready::oneShot,
                                              [weak = weak_from_this()](unsigned) {
                                                const auto self = weak.lock();
                                                if (self)
                                                  self->queue_->async([self] { self->acceptWhatCame(); });
                                              });
  }

  // A refusal (no memory, no room for another watch) must not make a deaf daemon: the next try has a new watch.
  void rearm() {
    MutexLock lock(mutex_);
    if (!accepting_) return;
    if (watch_ && watch_.rearm()) return;
    watch_ = Watch();
    watchLocked();
    if (!watch_) waitBeforeNextLocked("the system refuses to watch the socket");
  }

  // The waiting connection stays in the socket's backlog, so asking again at once would spin.
  void waitForDescriptors() {
    if (context_->services.counters.addAndMayLog(Reason::tooManyConnections,
                                                 context_->services.clock.monotonic())) {
      context_->services.log.error("DBusServer(accept): no descriptors left for new connections");
    }
    MutexLock lock(mutex_);
    pauseLocked(kExhaustedPause);
  }

  void waitBeforeNext(const char* problem) {
    MutexLock lock(mutex_);
    waitBeforeNextLocked(problem);
  }
  void waitBeforeNextLocked(const char* problem) REQUIRES(mutex_) {
    if (context_->services.counters.addAndMayLog(Reason::acceptFailed,
                                                 context_->services.clock.monotonic())) {
      context_->services.log.error("DBusServer(accept): %s, trying again", problem);
    }
    pauseLocked(kFailedPause);
  }
  void pauseLocked(Duration time) REQUIRES(mutex_) {
    pause_ = context_->services.timers.after(time, queue_, [weak = weak_from_this()] {
      if (const auto self = weak.lock()) self->acceptWhatCame();
    });
  }

  void take(std::unique_ptr<Stream> stream) REQUIRES(*queue_) {
    PeerCredentials peer = stream->peer();
    const uint32_t user = peer.uid;
    std::shared_ptr<UserAccount> account = context_->services.budget.account(user);
    if (const auto reason = context_->admit(*account)) return refuse(std::move(stream), *reason, user);
    const uint64_t number = ++lastNumber_;
    const auto connection = std::make_shared<DBusConnection>(context_, std::move(stream), std::move(peer),
                                                             std::move(account), number);
    connection->offer(listener_, *delegate_);
  }

  // Counted before the client sees its end. Closed by a worker of its user's: descriptors that were sent already can
  // hold up who closes them.
  void refuse(std::unique_ptr<Stream> stream, Reason reason, uint32_t user) {
    if (context_->services.counters.addAndMayLog(reason, context_->services.clock.monotonic())) {
      context_->services.log.normal("DBusServer(accept): connection of user %u refused: %s", user,
                                    reasonName(reason));
    }
    SerialQueue::create("kyt.refused", context_->services.executor, uint64_t{user} + 1)
        ->async([refused = std::move(stream)]() mutable { refused.reset(); });
  }

  const std::shared_ptr<ServerContext> context_;
  const std::unique_ptr<StreamAcceptor> acceptor_;
  Listener& listener_;
  const std::shared_ptr<SerialQueue> queue_;
  ListenerDelegate* delegate_ = nullptr;
  uint64_t lastNumber_ GUARDED_BY(*queue_) = 0;
  Mutex mutex_;
  Watch watch_ GUARDED_BY(mutex_);
  TimerHandle pause_ GUARDED_BY(mutex_);
  bool accepting_ GUARDED_BY(mutex_) = false;
  bool stopped_ GUARDED_BY(mutex_) = false;  // for good
};

DBusServer::DBusServer(DBusServerServices services, std::unique_ptr<StreamAcceptor> acceptor)
    : context_(std::make_shared<ServerContext>(std::move(services))),
      acceptance_(std::make_shared<Acceptance>(context_, std::move(acceptor), *this)) {}

DBusServer::~DBusServer() {
  stopAccepting();
  for (const auto& connection : context_->connections()) connection->abandon();
}

void DBusServer::resume() {
  if (delegate_ != nullptr) acceptance_->start(*delegate_);
}

void DBusServer::stopAccepting() {
  acceptance_->stop();
  acceptance_->wait();
}

void DBusServer::pauseAccepting() {
  acceptance_->pause();
  acceptance_->wait();
}

void DBusServer::resumeAccepting() {
  acceptance_->resume();
}

void DBusServer::invalidateConnections() {
  for (const auto& connection : context_->connections()) connection->invalidate();
}

}  // namespace kyt
