#include "daemon/DaemonServices.h"

#include <chrono>
#include <utility>

#include "backends/BackendTable.h"
#include "platform/base/Semaphore.h"
#include "platform/linux/base/Threads.h"
#include "platform/linux/service/Process.h"

namespace kyt {

namespace {

// How often the shut-down looks at what gives no event of its own.
constexpr Duration kPollPeriod = std::chrono::milliseconds(5);
constexpr Duration kCancelGrace = std::chrono::seconds(1);  // for what was cancelled to call its completions

WorkerPoolOptions workerPoolOptions(Counters& counters, Log& log, const UserBudget& budget) {
  WorkerPoolOptions options;
  options.counters = &counters;
  options.log = &log;
  options.maxWorkers = Limits::maxWorkers;
  options.mostOfOneOwner = budget.most(Share::workers);
  options.nameThread = beginServiceThread;
  options.whenQuiet = giveFreeMemoryBack;
  return options;
}

CurlURLSessionOptions urlSessionOptions(const Settings& settings) {
  CurlURLSessionOptions options;
  options.certificateFile = settings.caFile;
  options.cellularInterfaces = settings.cellularInterfaces;
  options.whenQuiet = giveFreeMemoryBack;  // replies may end long after the last worker did
  return options;
}

TomlUserDefaultsOptions userDefaultsOptions(const Paths& paths, const UserBudget& budget) {
  TomlUserDefaultsOptions options;
  options.folder = paths.userDefaults();
  options.mostIdentifiersOfAUser = budget.most(Share::identifiers);
  return options;
}

DeviceSources deviceSources(const Paths& paths) {
  DeviceSources sources;
  sources.overrides = paths.device();
  return sources;
}

// Under a private root, files of the daemon's own user may grant entitlements too.
TomlEntitlementsOptions entitlementsOptions(const Paths& paths) {
  TomlEntitlementsOptions options{paths.entitlements(), std::nullopt};
  if (!paths.root.empty()) options.trustedUser = currentUser();
  return options;
}

// What the wire protocol calls the machine's identifier: 32 hexadecimal digits that stay the same on this
// device and tell nothing about it, since any client may ask for them.
std::string wireMachineId(DeviceIdentity& identity, Cryptography& cryptography) {
  char deviceID[kDeviceIDSize] = {};
  identity.deviceUniqueIDCString(deviceID, kDeviceIDSize);
  const std::string text = std::string("com.vantu.kytreportingd ") + deviceID;
  const auto digest = cryptography.sha256(std::as_bytes(std::span(text)));
  constexpr char digits[] = "0123456789abcdef";
  std::string id;
  for (size_t i = 0; i < 16; ++i) {
    const auto byte = std::to_integer<unsigned>(digest[i]);
    id += digits[byte >> 4];
    id += digits[byte & 15];
  }
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
    : settings_(start.settings),
      log_(start.log),
      counters_(start.counters),
      idle_(std::move(start.idle)),
      budget_(UserShares::of(settings_.limits, start.memory, start.descriptors)),
      reactor_(std::move(start.reactor)),
      workers_(workerPoolOptions(counters_, log_, budget_)),
      deflate_(std::move(start.deflate)),
      userDefaults_(userDefaultsOptions(start.paths, budget_), log_, counters_, clock_),
      deviceProperties_(deviceSources(start.paths), cryptography_, log_, clock_),
      consent_(userDefaults_),
      clientBundle_(start.paths.clientBundle(), log_),
      daemonBundle_(start.paths.daemonBundle(), log_),
      entitlements_(entitlementsOptions(start.paths), start.inspector, log_, counters_, clock_),
      urlSessions_(urlSessionOptions(settings_), log_, counters_),
      fileExtensions_(start.broker, log_, counters_, budget_),
      pluginBundles_(start.paths.root, log_),
      powerLog_(counters_),
      platform_{
          .limits = settings_.limits,
          .counters = counters_,
          .log = log_,
          .clock = clock_,
          .timers = *reactor_,
          .reactor = *reactor_,
          .executor = workers_,
          .random = random_,
          .userDefaults = userDefaults_,
          .deviceProperties = deviceProperties_,
          .consent = consent_,
          .cryptography = cryptography_,
          .propertyLists = propertyLists_,
          .json = json_,
          .deflate = *deflate_,
          .memory = memory_,
          .urlSessions = urlSessions_,
          .udpSockets = udpSockets_,
          .clientBundle = clientBundle_,
          .daemonBundle = daemonBundle_,
          .fileExtensions = fileExtensions_,
          .pluginBundles = pluginBundles_,
          .powerLog = powerLog_,
          .budget = budget_,
      },
      deviceIdentity_(platform_),
      environment_(platform_, deviceIdentity_,
                   StorebagHosts{settings_.storebagInternalHost, settings_.storebagPublicHost}),
      configuration_{platform_, deviceIdentity_, environment_},
      backendFactory_(configuration_, backendTable(configuration_)),
      messageLog_(start.paths.messageLogs(), fileManager_, clock_, log_, counters_,
                  budget_.most(Share::messageLogBytes)),
      fetcher_(configuration_, backendClassLock_),
      sessionClass_(configuration_, backendFactory_, messageLog_),
      queue_(SerialQueue::create("com.vantu.kytreportingd", workers_)),
      lineLimits_(log_, clock_, *reactor_, queue_, budget_.most(Share::logLines)),
      transaction_({start.socketActivated, settings_.limits.idleExitSeconds}, *reactor_, queue_,
                   [this] { return endWhenIdle(); }),
      agent_(configuration_, fetcher_, sessionClass_, transaction_),
      listener_(DBusServerServices{settings_.limits, counters_, log_, clock_, *reactor_, workers_, *reactor_,
                                   entitlements_, budget_, wireMachineId(deviceIdentity_, cryptography_)},
                std::move(start.acceptor)) {
  listener_.setDelegate(agent_);
}

DaemonServices::~DaemonServices() = default;

void DaemonServices::resume() {
  listener_.resume();
  resumed_ = true;
  if (const auto interval = Watchdog::requestedInterval())
    watchdog_.emplace(*interval, *reactor_, workers_, &ServiceManager::alive);
}

// Requests, and datagrams that are still sent again, may outlive their session.
bool DaemonServices::isOutstanding() const {
  return urlSessions_.outstanding() != 0 || udpSockets_.openSockets() != 0;
}

// The idle time counts anew from the end of what a session left behind. A connection may be on its way to becoming a
// session, and before the start is over nothing here may be looked at.
bool DaemonServices::isIdle() const {
  return resumed_ && listener_.connectionCount() == 0 && agent_.sessionCount() == 0 && !isOutstanding();
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
  const Deadline deadline(clock_, settings_.limits.shutdownGraceSeconds);
  // Where the system refuses threads the deadline holds all the same.
  workers_.stopInsisting();
  listener_.stopAccepting();
  // Downloads and uploads end in their error paths, and none begins: before anything that needs the agent's
  // monitor, which a download holds, and so that no session's end waits behind its own upload.
  urlSessions_.cancelAwaited();
  endSessions(deadline);
  waitForRequests(deadline);
  if (!deadline.waitUntil([this] { return listener_.connectionCount() == 0; }))
    listener_.invalidateConnections();
  // What a client passed may keep a thread (the reading or closing of a file, of a socket) for as long as it likes.
  const bool workersEnd = workers_.shutDownWithin(deadline.left() + kCancelGrace);
  // Completions write to the message log and more that is destroyed before the URL sessions are.
  const bool threadsEnd = urlSessions_.shutDownWithin(deadline.left() + kCancelGrace) && workersEnd;
  if (threadsEnd)
    reactor_->stop();
  else
    log_.error("shutDown: Threads still wait for what clients passed, ending without them");
  lineLimits_.finish();
  logFigures();
  return threadsEnd;
}

bool DaemonServices::sessionsEndWithin(const Deadline& deadline) {
  constexpr Duration kRefusedThreadPause = std::chrono::milliseconds(50);
  for (;;) {
    const Duration left = deadline.left();
    if (agent_.waitUntilSessionsHaveEnded(std::min(left, kRefusedThreadPause))) return true;
    if (left <= Duration(0)) return false;
    workers_.tryAgain();
  }
}

void DaemonServices::endSessions(const Deadline& deadline) {
  agent_.finishAllSessions();
  if (sessionsEndWithin(deadline)) return;
  log_.error("shutDown: Sessions have not ended in time, cancelling what they wait for");
  urlSessions_.cancelAll();
  listener_.invalidateConnections();
  static_cast<void>(agent_.waitUntilSessionsHaveEnded(kCancelGrace));
}

void DaemonServices::waitForRequests(const Deadline& deadline) {
  const auto done = [this] { return !isOutstanding(); };
  if (deadline.waitUntil(done)) return;
  if (urlSessions_.outstanding() == 0) return;  // datagrams that nobody has acknowledged are given up
  log_.error("shutDown: Cancelling %zu requests that have not been answered in time",
             urlSessions_.outstanding());
  urlSessions_.cancelAll();
  static_cast<void>(deadline.waitUntil([this] { return urlSessions_.outstanding() == 0; }, kCancelGrace));
}

void DaemonServices::logFigures() {
  const URLFigures figures = urlSessions_.figures();
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
}

}  // namespace kyt
