#include "daemon/Administration.h"

#include <memory>
#include <utility>

#include "daemon/WatchedEvents.h"
#include "platform/Platform.h"
#include "platform/base/Books.h"
#include "platform/base/Limits.h"
#include "platform/queues/Log.h"
#include "platform/queues/SerialQueue.h"
#include "platform/queues/Timer.h"

namespace kyt {

namespace {

constexpr char kOutboxIsOff[] = "There is no outbox: outbox.enabled in kytreportingd.toml is not set";

std::string refusalOf(const AdministrationAccess& access) {
  std::string text = "Only root, the daemon's own user";
  text += access.group ? " and members of the group " + access.groupName : std::string();
  return text + " may look at the daemon (admin.group in kytreportingd.toml)";
}

}  // namespace

// One connection's.
class Administration::Window final : public AdministrationInterface {
 public:
  Window(const Administration& all, bool mayLook, bool ownsDaemon, std::shared_ptr<SerialQueue> queue)
      : all_(all), mayLook_(mayLook), ownsDaemon_(ownsDaemon), queue_(std::move(queue)) {}
  [[nodiscard]] const char* refusal() const override { return mayLook_ ? nullptr : all_.refusal_.c_str(); }
  [[nodiscard]] Dictionary status() override { return all_.status(); }
  [[nodiscard]] std::vector<Dictionary> sessions(size_t most) override { return all_.sessions(most); }
  [[nodiscard]] std::vector<Dictionary> books(size_t mostRowsOfUser) override {
    return all_.books(mostRowsOfUser);
  }
  [[nodiscard]] std::vector<Dictionary> storebags() override { return all_.storebags(); }
  [[nodiscard]] std::optional<Dictionary> storebag(std::string_view name) override {
    return all_.storebag(name);
  }
  [[nodiscard]] std::string metrics(size_t mostRowsOfUser) override { return all_.metrics(mostRowsOfUser); }
  [[nodiscard]] std::optional<std::string> setLogLevel(std::string_view level) override {
    return all_.setLogLevel(level);
  }
  [[nodiscard]] std::optional<std::string> reload(std::vector<std::string>& lines) override {
    return all_.reload(lines);
  }
  [[nodiscard]] std::optional<AdministrationRefusal> watch(const Dictionary& filter,
                                                           PassedSignal signal) override;
  [[nodiscard]] std::vector<Dictionary> outbox() override {
    return all_.hasOutbox() ? all_.outbox().view() : std::vector<Dictionary>();
  }
  [[nodiscard]] std::optional<AdministrationRefusal> flushOutbox() override;
  [[nodiscard]] std::optional<AdministrationRefusal> dropOutbox(const Dictionary& filter,
                                                                uint64_t& dropped) override;

 private:
  const Administration& all_;
  const bool mayLook_, ownsDaemon_;
  const std::shared_ptr<SerialQueue> queue_;  // the connection's
  std::shared_ptr<Watching> watching_;
};

// Gives a connection what its watcher has, as fast as the peer reads it. The connection's queue.
class Administration::Watching {
 public:
  Watching(std::unique_ptr<Watcher> watcher, PassedSignal signal)
      : watcher_(std::move(watcher)), signal_(std::move(signal)) {}

  // A timer looks, so that whoever tells an event wakes nobody.
  static void start(const std::shared_ptr<Watching>& watching, TimerService& timers,
                    const std::shared_ptr<SerialQueue>& queue) {
    watching->timer_ = timers.every(Limits::watchPeriod, Limits::watchPeriod / 2, queue,
                                    [weak = std::weak_ptr<Watching>(watching)] {
                                      if (const auto self = weak.lock()) self->show();
                                    });
  }

 private:
  // What the peer has no room for is tried again; meanwhile the ring fills.
  void show() {
    for (size_t i = 0; i < Limits::maxWatchedEvents; ++i) {
      if (!waiting_) {
        const std::shared_ptr<const PassedEvent> event = watcher_->next();
        if (event == nullptr) return;
        waiting_ = passedView(*event, watcher_->wantsBodies());
      }
      lost_ += watcher_->takeLost();
      if (lost_ != 0) waiting_->set("lost", lost_);
      if (!signal_(*waiting_)) return;
      waiting_.reset();
      lost_ = 0;
    }
  }

  const std::unique_ptr<Watcher> watcher_;
  PassedSignal signal_;
  std::optional<Dictionary> waiting_;  // taken from the ring, and not sent
  uint64_t lost_ = 0;                  // not told yet
  TimerHandle timer_;
};

std::optional<AdministrationRefusal> Administration::Window::watch(const Dictionary& filter,
                                                                   PassedSignal signal) {
  WatchFilter wanted;
  if (const char* problem = readWatchFilter(filter, wanted))
    return AdministrationRefusal{AdministrationRefusal::Why::wrongFilter, problem};
  if (wanted.bodies && !ownsDaemon_)
    return AdministrationRefusal{AdministrationRefusal::Why::notAllowed,
                                 "Only root and the daemon's own user may see what is in events"};
  watching_.reset();
  std::unique_ptr<Watcher> watcher = all_.watch(std::move(wanted), ownsDaemon_);
  if (watcher == nullptr)
    return AdministrationRefusal{
        AdministrationRefusal::Why::tooMany,
        std::to_string(ownsDaemon_ ? Limits::maxWatchers : Limits::maxWatchersOfGroup) +
            " watch already: no more can"};
  watching_ = std::make_shared<Watching>(std::move(watcher), std::move(signal));
  Watching::start(watching_, all_.sources_.platform.timers, queue_);
  return std::nullopt;
}

std::optional<AdministrationRefusal> Administration::Window::flushOutbox() {
  if (!all_.hasOutbox()) return AdministrationRefusal{AdministrationRefusal::Why::isOff, kOutboxIsOff};
  all_.sources_.platform.log.normal("administration: The outbox is asked to send now");
  all_.outbox().flush();
  return std::nullopt;
}

// Who may look can delete nothing.
std::optional<AdministrationRefusal> Administration::Window::dropOutbox(const Dictionary& filter,
                                                                        uint64_t& dropped) {
  if (!ownsDaemon_)
    return AdministrationRefusal{AdministrationRefusal::Why::notAllowed,
                                 "Only root and the daemon's own user may drop what the outbox keeps"};
  OutboxFilter wanted;
  if (const char* problem = readOutboxFilter(filter, wanted))
    return AdministrationRefusal{AdministrationRefusal::Why::wrongFilter, problem};
  if (!all_.hasOutbox()) return AdministrationRefusal{AdministrationRefusal::Why::isOff, kOutboxIsOff};
  const auto done = all_.outbox().drop(std::move(wanted.server), wanted.user);
  dropped = done.posts;
  all_.sources_.platform.log.normal("administration: %llu posts of the outbox are dropped",
                                    static_cast<unsigned long long>(dropped));
  if (done.problem == nullptr) return std::nullopt;
  return AdministrationRefusal{AdministrationRefusal::Why::failed,
                               std::to_string(dropped) + " posts are dropped, but " + done.problem};
}

std::unique_ptr<Watcher> Administration::watch(WatchFilter filter, bool isOwner) const {
  return sources_.platform.books.watchers()->watch(std::move(filter), isOwner);
}

Administration::Administration(AdministrationSources sources, AdministrationAccess access)
    : sources_(std::move(sources)), access_(std::move(access)), refusal_(refusalOf(access_)) {}

bool Administration::listenerShouldAcceptNewConnection(Listener& /*listener*/,
                                                       const std::shared_ptr<Connection>& connection) {
  const uint32_t user = connection->peerUser();
  const bool ownsDaemon = user == 0 || user == access_.user;
  const bool mayLook = ownsDaemon || (access_.group && connection->isPeerInGroup(*access_.group));
  if (!mayLook)
    sources_.platform.log.debug("administration: Connection %s may not look",
                                connection->description().c_str());
  connection->setExportedObject(std::make_shared<Window>(*this, mayLook, ownsDaemon, connection->queue()));
  connection->resume();
  return true;
}

std::optional<std::string> Administration::setLogLevel(std::string_view level) const {
  Log& log = sources_.platform.log;
  if (level != "debug" && level != "default" && level != "error")
    return "the level must be \"debug\", \"default\" or \"error\"";
  log.normal("administration: Lines are logged from the level %s on", std::string(level).c_str());
  log.setLevel(level == "debug" ? LogLevel::debug : level == "error" ? LogLevel::error : LogLevel::normal);
  return std::nullopt;
}

}  // namespace kyt
