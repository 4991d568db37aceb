#include "daemon/DaemonServices.h"

#include <chrono>
#include <cstdlib>
#include <utility>

#include "backends/BackendTable.h"
#include "platform/base/Hex.h"
#include "platform/base/Semaphore.h"
#include "platform/ipc/AdministrationDispatcher.h"
#include "platform/linux/service/Process.h"

namespace kyt {

namespace {

// How often the shut-down looks at what gives no event of its own.
constexpr Duration kPollPeriod = std::chrono::milliseconds(5);
constexpr Duration kCancelGrace = std::chrono::seconds(1);  // for what was cancelled to call its completions

// What the wire protocol calls the machine's identifier: 32 hexadecimal digits that stay the same on this
// device and tell nothing about it, since any client may ask for them.
std::string wireMachineId(DeviceIdentity& identity, Cryptography& cryptography) {
  char deviceID[kDeviceIDSize] = {};
  identity.deviceUniqueIDCString(deviceID, kDeviceIDSize);
  const std::string text = std::string("com.vantu.kytreportingd ") + deviceID;
  const auto digest = cryptography.sha256(std::as_bytes(std::span(text)));
  std::string id;
  appendHex(std::span(digest).first(16), id);
  return id;
}

}  // namespace

class DaemonServices::Deadline {
 public:
  Deadline(Clock& clock, double seconds)
      : clock_(clock),
        end_(clock.monotonic() +
             std::chrono::duration_cast<Duration>(std::chrono::duration<double>(seconds))) {}
  [[nodiscard]] Duration left() const { return std::max(Duration(0), end_ - clock_.monotonic()); }
  // Whether the condition held before the end, and `grace` after it at the latest.
  template <typename Condition>
  [[nodiscard]] bool waitUntil(Condition condition, Duration grace = Duration(0)) const {
    Semaphore never;
    while (!condition()) {
      if (clock_.monotonic() >= end_ + grace) return false;
      static_cast<void>(never.waitFor(kPollPeriod));
    }
    return true;
  }

 private:
  Clock& clock_;
  const MonotonicTime end_;
};

DaemonServices::DaemonServices(Start start)
    : settings_(start.system.settings),
      log_(start.system.log),
      counters_(start.system.counters),
      idle_(std::move(start.idle)),
      system_(std::move(start.system)),
      reload_({std::move(start.reload.file), start.reload.running, log_, start.reload.commandLine,
               [this](const Settings& changed) { system_.takeUp(changed); }}),
      deviceIdentity_(system_.ports),
      environment_(system_.ports, deviceIdentity_,
                   StorebagHosts{settings_.storebagInternalHost, settings_.storebagPublicHost}),
      configuration_{system_.ports, deviceIdentity_, environment_},
      backendFactory_(configuration_, backendTable(configuration_)),
      messageLog_(start.messageLogs, system_.files, system_.clock, log_, counters_,
                  system_.budget.most(Share::messageLogBytes)),
      fetcher_(configuration_, backendClassLock_, settings_.storebagRefusals),
      sessionClass_(configuration_, backendFactory_, messageLog_),
      queue_(SerialQueue::create("com.vantu.kytreportingd", system_.workers)),
      lineLimits_(log_, system_.clock, *system_.reactor, queue_, system_.budget.most(Share::logLines)),
      transaction_({start.socketActivated, settings_.limits.idleExitSeconds}, *system_.reactor, queue_,
                   [this] { return endWhenIdle(); }),
      agent_(configuration_, fetcher_, sessionClass_, transaction_),
      listener_(serverServices(), std::move(start.acceptor)),
      administration_(administrationSources(std::move(start.window.version), start.system.inspector),
                      std::move(start.window.access)) {
  listener_.setDelegate(agent_);
  if (start.window.acceptor == nullptr) return;
  DBusServerServices services = serverServices();
  services.dispatcher = std::make_shared<AdministrationDispatcher>(counters_, services.machineId);
  windows_.emplace(std::move(services), std::move(start.window.acceptor));
  windows_->setDelegate(administration_);
}

DBusServerServices DaemonServices::serverServices() {
  return {settings_.limits,
          counters_,
          log_,
          system_.clock,
          *system_.reactor,
          system_.workers,
          *system_.reactor,
          system_.entitlements,
          system_.budget,
          wireMachineId(deviceIdentity_, system_.cryptography)};
}

AdministrationSources DaemonServices::administrationSources(std::string version,
                                                            ProgramInspector& inspector) {
  return {.platform = system_.ports,
          .sessions = sessionClass_.standings(),
          .storebags = agent_.storebags(),
          .servers = system_.servers,
          .version = std::move(version),
          .since = system_.clock.timeOfDay().seconds,
          .outbox = outboxOperations(),
          .connections = [this] { return listener_.connectionCount(); },
          .process =
              [] {
                const OwnFigures own = ownFigures();
                return ProcessFigures{own.pid, own.residentBytes, own.anonymousBytes, own.threads};
              },
          .programOf = [&inspector](int32_t process) { return inspector.programPath(process); },
          .reload =
              [this](std::vector<std::string>& lines) {
                DaemonReload::Outcome outcome = reload_.reload();
                lines = std::move(outcome.lines);
                return std::move(outcome.problem);
              }};
}

OutboxOperations DaemonServices::outboxOperations() {
  if (!system_.outbox) return {};
  Outbox& outbox = system_.outbox->outbox();
  return {.view = [this] { return system_.outbox->view(); },
          .flush = [&outbox] { outbox.flush(); },
          .drop =
              [&outbox](std::optional<std::string> server, std::optional<uint32_t> user) {
                const Outbox::Dropped dropped = outbox.drop({.server = std::move(server), .user = user});
                return OutboxOperations::Dropped{dropped.posts, dropped.problem};
              }};
}

DaemonServices::~DaemonServices() = default;

void DaemonServices::resume() {
  listener_.resume();
  if (windows_) windows_->resume();
  if (system_.outbox) system_.outbox->outbox().begin();
  resumed_ = true;
  if (const auto interval = Watchdog::requestedInterval())
    watchdog_.emplace(*interval, *system_.reactor, system_.workers, &ServiceManager::alive);
}

// Requests, and datagrams that are still sent again, may outlive their session.
bool DaemonServices::isOutstanding() const {
  return system_.urlSessions.outstanding() != 0 || system_.udpSockets.openSockets() != 0;
}

// The idle time counts anew from the end of what a session left behind; what could not be sent is to be sent when that is
// possible again. A connection may be on its way to becoming a
// session, and before the start is over nothing here may be looked at.
bool DaemonServices::isIdle() const {
  const bool isAllSent = !system_.outbox || system_.outbox->outbox().isEmpty();
  return resumed_ && listener_.connectionCount() == 0 && agent_.sessionCount() == 0 && !isOutstanding() &&
         isAllSent;
}

// The end of accepting comes before the decision is final: who connects from then on waits in the socket's line for the
// next daemon, and is not taken by one that tells its service manager goodbye.
bool DaemonServices::endWhenIdle() {
  if (!isIdle()) return false;
  listener_.pauseAccepting();
  if (isIdle()) {
    idle_();
    return true;
  }
  listener_.resumeAccepting();
  return false;
}

bool DaemonServices::shutDown() {
  const Deadline deadline(system_.clock, settings_.limits.shutdownGraceSeconds);
  // Where the system refuses threads the deadline holds all the same.
  system_.workers.stopInsisting();
  listener_.stopAccepting();
  if (windows_) windows_->stopAccepting();
  // Downloads and uploads end in their error paths, and none begins: before anything that needs the agent's
  // monitor, which a download holds, and so that no session's end waits behind its own upload.
  system_.urlSessions.cancelAwaited();
  if (system_.outbox) system_.outbox->outbox().stopSending();
  endSessions(deadline);
  waitForRequests(deadline);
  if (!deadline.waitUntil([this] { return listener_.connectionCount() == 0; }))
    listener_.invalidateConnections();
  if (windows_) windows_->invalidateConnections();
  // What a client passed may keep a thread (the reading or closing of a file, of a socket) for as long as it likes, and a
  // large batch one that writes and compresses it.
  const bool workersEnd = system_.workers.shutDownWithin(deadline.left() + kCancelGrace);
  // Completions write to the message log and more that is destroyed before the URL sessions are.
  bool threadsEnd = system_.network.shutDownWithin(deadline.left() + kCancelGrace) && workersEnd;
  if (system_.outbox)
    threadsEnd = system_.outbox->shutDownWithin(deadline.left() + kCancelGrace) && threadsEnd;
  if (threadsEnd)
    system_.reactor->stop();
  else
    log_.error("shutDown: Threads still work or wait for what clients passed, ending without them");
  lineLimits_.finish();
  system_.departures.flush();
  logFigures();
  return threadsEnd;
}

// The threads are not even asked to end: on their way they would send. Clients see their connection end, as when a daemon is
// killed. What left is written down, and what is on its way is cut off and may have left: whoever erases asks that file whom
// to name.
void DaemonServices::endWithoutSending() {
  if (system_.outbox) system_.outbox->outbox().stopSending();
  system_.urlSessions.cancelAll();
  const Deadline deadline(system_.clock, 0);
  static_cast<void>(
      deadline.waitUntil([this] { return system_.urlSessions.outstanding() == 0; }, kCancelGrace));
  logFigures();
  system_.departures.flush();
  std::_Exit(0);
}

bool DaemonServices::sessionsEndWithin(const Deadline& deadline) {
  constexpr Duration kRefusedThreadPause = std::chrono::milliseconds(50);
  for (;;) {
    const Duration left = deadline.left();
    if (agent_.waitUntilSessionsHaveEnded(std::min(left, kRefusedThreadPause))) return true;
    if (left <= Duration(0)) return false;
    system_.workers.tryAgain();
  }
}

void DaemonServices::endSessions(const Deadline& deadline) {
  agent_.finishAllSessions();
  if (sessionsEndWithin(deadline)) return;
  log_.error("shutDown: Sessions have not ended in time, cancelling what they wait for");
  system_.urlSessions.cancelAll();
  listener_.invalidateConnections();
  static_cast<void>(agent_.waitUntilSessionsHaveEnded(kCancelGrace));
}

void DaemonServices::waitForRequests(const Deadline& deadline) {
  const auto done = [this] { return !isOutstanding(); };
  if (deadline.waitUntil(done)) return;
  if (system_.urlSessions.outstanding() == 0) return;  // datagrams that nobody has acknowledged are given up
  log_.error("shutDown: Cancelling %zu requests that have not been answered in time",
             system_.urlSessions.outstanding());
  system_.urlSessions.cancelAll();
  static_cast<void>(
      deadline.waitUntil([this] { return system_.urlSessions.outstanding() == 0; }, kCancelGrace));
}

void DaemonServices::logFigures() {
  const URLFigures figures = system_.urlSessions.figures();
  log_.normal("shutDown: %llu requests started, %llu completed, %llu failed",
              static_cast<unsigned long long>(figures.started),
              static_cast<unsigned long long>(figures.completed),
              static_cast<unsigned long long>(figures.failed));
  for (size_t i = 0; i < static_cast<size_t>(Reason::numberOfReasons); ++i) {
    const auto reason = static_cast<Reason>(i);
    if (counters_.value(reason) != 0)
      log_.normal("shutDown: %s: %llu", reasonName(reason),
                  static_cast<unsigned long long>(counters_.value(reason)));
  }
  if (!log_.debugEnabled()) return;
  for (const BookRow& row : system_.books.snapshot())
    log_.debug("shutDown: books: %s", describeRow(row).c_str());
}

}  // namespace kyt
