#include "daemon/Daemon.h"

#include <algorithm>
#include <chrono>
#include <cmath>
#include <csignal>
#include <cstdlib>
#include <memory>
#include <optional>
#include <thread>
#include <utility>
#include <variant>

#include "daemon/DaemonServices.h"
#include "platform/base/Paths.h"
#include "platform/base/Settings.h"
#include "platform/linux/base/CodePages.h"
#include "platform/linux/base/EpollReactor.h"
#include "platform/linux/base/StopSignals.h"
#include "platform/linux/base/UnixSocket.h"
#include "platform/linux/confinement/Capabilities.h"
#include "platform/linux/confinement/LinuxConfinement.h"
#include "platform/linux/data/MakeDeflate.h"
#include "platform/linux/device/DepartureFile.h"
#include "platform/linux/entitlements/AccountNumbers.h"
#include "platform/linux/files/Files.h"
#include "platform/linux/helpers/DeletionBroker.h"
#include "platform/linux/helpers/ProgramInspector.h"
#include "platform/linux/service/LogSinks.h"
#include "platform/linux/service/MachineResources.h"
#include "platform/linux/service/MemoryReserve.h"
#include "platform/linux/service/Process.h"
#include "platform/linux/service/ServiceManager.h"
#include "platform/linux/toml/TomlSettings.h"
#include "platform/objects/Keys.h"

namespace kyt {

namespace {

constexpr int kCouldNotStart = 1;
constexpr int kOutOfMemory = 1;
constexpr int kNotConfined = -1;
constexpr Duration kErasurePatience = std::chrono::seconds(10);
constexpr uint32_t kPublicFolder = 0755;   // clients look the socket up in it
constexpr uint32_t kPrivateFolder = 0750;  // identifiers, and what was sent
constexpr uint32_t kSecretFolder = 0700;   // what is to be sent

// The folders that the daemon writes to, which the confinement names, so they must exist before it.
std::optional<std::string> makeMissingFolders(const Paths& paths, const Settings& settings) {
  if (settings.outbox.enabled)
    if (auto error = makeFolders(paths.outbox(), kSecretFolder)) return error;
  if (auto error = makeFolders(paths.run(), kPublicFolder)) return error;
  return makeFolders(paths.userDefaults(), kPrivateFolder);
}

// The folder in which the message log's lies, and is made again when it was removed. Where either cannot be made the daemon
// serves all the same: each line of the message log says what is wrong. Empty: none.
std::string folderOfMessageLogs(const Paths& paths, Log& log) {
  const auto above = makeFolders(paths.systemLogs(), kPublicFolder);
  const auto error = above ? above : makeFolders(paths.messageLogs(), kPrivateFolder);
  if (error) log.error("main: No message log: %s", error->c_str());
  return above ? std::string() : paths.systemLogs();
}

LinuxConfinement confinementOf(const Paths& paths, const std::string& config, const Settings& settings,
                               const std::string& logs) {
  return LinuxConfinement(paths.kytShare(),
                          {{"CONFIG", paths.configuration()},
                           {"SETTINGS", config == paths.settings() ? "" : folderOf(config)},
                           {"SHARE", paths.kytShare()},
                           {"PLUGINS", paths.plugIns()},
                           {"STATE", paths.userDefaults()},
                           {"OUTBOX", settings.outbox.enabled ? paths.outbox() : ""},
                           {"LOGS", logs},
                           {"RUN", paths.run()},
                           {"CA", settings.caFile.empty() ? "" : folderOf(settings.caFile)}});
}

// What is confined less than the profile says, since the kernel is older than what it asks for.
void logWhatIsNotEnforced(const LinuxConfinement& confinement, Log& log) {
  for (const std::string& what : confinement.notEnforced())
    log.normal("confinement: this kernel cannot %s", what.c_str());
  if (!kernelTellsPeerProcess())
    log.normal(
        "confinement: this kernel cannot tell which process is connected (6.5 can): grants that name an "
        "executable match nobody");
}

// Only after the helpers were forked, which need what is given up here.
std::optional<std::string> confine(Confinement& confinement) {
  if (const int error = giveUpCapabilities()) return "capabilities: " + errorText(error);
  return confinement.enter(kServiceName);
}

// The socket that the service manager handed over, or one of our own.
std::variant<std::unique_ptr<UnixSocketAcceptor>, Error> listeningSocket(const Paths& paths) {
  auto activated = UnixSocketAcceptor::adoptActivated();
  const auto* adopted = std::get_if<std::unique_ptr<UnixSocketAcceptor>>(&activated);
  if (adopted == nullptr || *adopted != nullptr) return activated;
  return UnixSocketAcceptor::bindAt(paths.socket());
}

// Which programs peers run is asked by a process outside the confinement; without it, grants that name an
// executable match nobody.
std::unique_ptr<ProgramInspector> programInspector(Log& log) {
  auto started = ProgramInspectorProcess::start();
  if (const auto* error = std::get_if<std::string>(&started)) {
    log.error("main: Cannot look at the programs of clients: %s", error->c_str());
    return std::make_unique<DirectProgramInspector>();
  }
  return std::move(std::get<std::unique_ptr<ProgramInspectorProcess>>(started));
}

// Files that were uploaded are removed by a process outside the confinement, which alone may take its clients'
// users; without it they stay.
std::unique_ptr<DeletionBroker> deletionBroker(const LinuxConfinement& confinement, Log& log) {
  auto started = DeletionBroker::start(confinement.openPaths(kServiceName));
  if (const auto* error = std::get_if<std::string>(&started)) {
    log.error("main: Cannot remove files that were uploaded: %s", error->c_str());
    return nullptr;
  }
  return std::move(std::get<std::unique_ptr<DeletionBroker>>(started));
}

// Past the grace time, for what has a limit of its own: what was cancelled, the threads, the helpers.
std::chrono::seconds lastMoment(const Limits& limits) {
  constexpr std::chrono::seconds kForTheRest{8};
  return kForTheRest + std::chrono::seconds(static_cast<int64_t>(std::ceil(limits.shutdownGraceSeconds)));
}

int waitForTheEnd(StopSignals& signals, DaemonServices& services) {
  for (;;) {
    const int signal = signals.wait();
    if (signal != SIGHUP) return signal;
    services.reload();
  }
}

// Who may look at the daemon: members of the group, which the system may not know.
AdministrationAccess administrationAccess(const Settings& settings, Log& log) {
  AdministrationAccess access{.user = currentUser(), .group = std::nullopt, .groupName = settings.adminGroup};
  if (settings.adminGroup.empty()) return access;
  access.group = AccountNumbers().group(settings.adminGroup);
  if (!access.group)
    log.error(
        "main: There is no group \"%s\" (admin.group): root and the daemon's user alone may look at the daemon",
        settings.adminGroup.c_str());
  return access;
}

// Made while the process may still take the group. Without it the daemon serves all the same.
std::unique_ptr<UnixSocketAcceptor> administrationSocket(const Paths& paths,
                                                         const AdministrationAccess& access, Log& log) {
  auto made = UnixSocketAcceptor::bindForGroup(paths.administration(), access.group);
  if (const Error* error = std::get_if<Error>(&made); error != nullptr && access.group) {
    log.error("main: The group \"%s\" cannot look at the daemon: %s", access.groupName.c_str(),
              error->localizedDescription.c_str());
    made = UnixSocketAcceptor::bindForGroup(paths.administration(), std::nullopt);
  }
  if (const Error* error = std::get_if<Error>(&made)) {
    log.error("main: Nobody can look at the daemon: %s", error->localizedDescription.c_str());
    return nullptr;
  }
  return std::move(std::get<std::unique_ptr<UnixSocketAcceptor>>(made));
}

// Waits until nobody erases what the daemon knows; whoever will keeps the lock meanwhile, as the daemon does while it runs.
enum class Erasure { over, goesOn, endAsked };
Erasure waitForErasure(const std::string& folder, ErasureMark& mark, std::optional<DaemonLock>& lock,
                       StopSignals& signals, Log& log) {
  bool isTold = false;
  const auto goOn = [&] {
    if (mark.isHeld() && !std::exchange(isTold, true))
      log.normal("main: The owner erases what is known: waiting until that is done");
    return !signals.isEndAsked();
  };
  constexpr std::chrono::milliseconds kPause{5};
  const MonotonicTime end = std::chrono::steady_clock::now() + kErasurePatience;
  for (;;) {
    std::string problem;
    const Duration left =
        std::max(end - std::chrono::steady_clock::now(), std::chrono::steady_clock::duration(0));
    lock = DaemonLock::take(folder, left, problem, goOn);
    if ((!lock || mark.isHeld()) && !goOn()) return Erasure::endAsked;
    if (!mark.isHeld()) {
      if (!lock) log.error("main: Cannot keep others from erasing: %s", problem.c_str());
      static_cast<void>(mark.remove());  // of an erasure that was cut off
      return Erasure::over;
    }
    lock.reset();  // it was taken first, and is the eraser's
    if (std::chrono::steady_clock::now() >= end) return Erasure::goesOn;
    std::this_thread::sleep_for(kPause);
  }
}

struct Configured {
  Settings& settings;
  const Paths& paths;
  std::string settingsFile;
  std::optional<LogLevel> logLevel;  // the command line's
};

int serve(const Configured& configured, Log& log, Counters& counters, ProgramInspector& inspector,
          const DeletionBroker* broker, std::unique_ptr<Deflate> deflate, uint64_t memory,
          Confinement& confinement, StopSignals& stopSignals, DaemonServices::WindowStart window) {
  Settings& settings = configured.settings;
  const Paths& paths = configured.paths;
  auto socket = listeningSocket(paths);
  if (const Error* error = std::get_if<Error>(&socket)) {
    log.error("main: %s", error->localizedDescription.c_str());
    return kCouldNotStart;
  }
  auto& acceptor = std::get<std::unique_ptr<UnixSocketAcceptor>>(socket);
  const bool activated = acceptor->activated();
  if (const auto error = confinement.endStart()) {
    log.error("main: confine_init() fails: %s\n", error->c_str());
    return kNotConfined;
  }
  const MemoryReserve reserve(stopSignals);
  std::unique_ptr<EpollReactor> reactor = EpollReactor::create();
  if (reactor == nullptr) {
    log.error("main: Cannot start the reactor");
    return kCouldNotStart;
  }
  ErasureMark mark(paths.userDefaults());
  std::optional<DaemonLock> lock;
  switch (waitForErasure(paths.userDefaults(), mark, lock, stopSignals, log)) {
    case Erasure::over:
      break;
    case Erasure::goesOn:
      log.error("main: The owner still erases what is known: not starting");
      return kCouldNotStart;
    case Erasure::endAsked:
      log.normal("main: Ending before the start is over");
      return 0;
  }
  log.allowThreads();
  DaemonServices services({.system = {.settings = settings,
                                      .paths = paths,
                                      .log = log,
                                      .counters = counters,
                                      .inspector = inspector,
                                      .broker = broker,
                                      .reactor = std::move(reactor),
                                      .deflate = std::move(deflate),
                                      .memory = memory,
                                      .descriptors = LinuxConfinement::descriptorLimit()},
                           .messageLogs = paths.messageLogs(),
                           .acceptor = std::move(acceptor),
                           .window = std::move(window),
                           .reload = {settings, configured.settingsFile, configured.logLevel},
                           .socketActivated = activated,
                           .idle = [&stopSignals] { stopSignals.request(); }});
  services.resume();
  log.normal("main: Listener resumes with sandbox, start loop.");
  ServiceManager::ready("Listening");
  static_cast<void>(giveBackCodePages());
  const int signal = waitForTheEnd(stopSignals, services);
  endProcessAtTheLatest(lastMoment(settings.limits), reserve.isUsed() ? kOutOfMemory : 0);
  if (reserve.isUsed())
    log.error("main: Ending, the system refuses memory");
  else if (signal != 0)
    log.normal("main: Ending on signal %d", signal);
  else
    log.normal("main: Ending, idle for %g seconds", settings.limits.idleExitSeconds);
  ServiceManager::stopping();
  if (mark.stands()) {
    log.normal("main: The owner erases what is known: what waits is not sent");
    services.endWithoutSending();
  }
  const bool ended = services.shutDown();
  const int status = reserve.isUsed() ? kOutOfMemory : 0;
  if (!ended) std::_Exit(status);  // threads that do not end use all that would be destroyed here
  return status;
}

}  // namespace

int runDaemon(const DaemonOptions& options) {
  fillStandardDescriptors();
  StopSignals stopSignals;  // from here on a SIGHUP that comes early ends nothing
  StderrSink standardError;
  Log log(standardError, options.logLevel.value_or(LogLevel::normal));
  const Paths paths = Paths::of(absolutePath(options.root), executableFolder());
  const std::string config = options.config.empty() ? paths.settings() : absolutePath(options.config);
  auto read = readSettings(config);
  if (const auto* error = std::get_if<TomlError>(&read)) {
    log.error("main: %s", error->text.c_str());
    return kCouldNotStart;
  }
  Settings& settings = std::get<Settings>(read);
  if (!options.logLevel) log.setLevel(settings.logLevel);
  Counters counters;
  const std::unique_ptr<LogSink> sink = makeLogSink(settings.logTarget, counters);
  log.setSink(*sink);
  if (auto error = makeMissingFolders(paths, settings)) {
    log.error("main: %s", error->c_str());
    return kCouldNotStart;
  }

  const std::string logs = folderOfMessageLogs(paths, log);

  giveLargeBlocksBack();
  shareHeaps();
  // The service class is inherited by every thread that starts later.
  if (!enterUtilityServiceClass()) log.debug("main: The system refused the utility service class");
  if (stopSignals.error() != 0) {
    log.error("main: Cannot wait for signals: %s", errorText(stopSignals.error()).c_str());
    return kCouldNotStart;
  }
  log.normal("startLogging: Daemon starts logging...");
  std::unique_ptr<Deflate> deflate = makeDeflate(settings.compression, log);
  LinuxConfinement confinement = confinementOf(paths, config, settings, logs);
  const std::unique_ptr<DeletionBroker> broker = deletionBroker(confinement, log);
  const std::unique_ptr<ProgramInspector> inspector = programInspector(log);
  const uint64_t memory = memoryForTheDaemon();
  DaemonServices::WindowStart window;
  window.version = options.version;
  window.access = administrationAccess(settings, log);
  window.acceptor = administrationSocket(paths, window.access, log);
  if (const auto error = confine(confinement)) {
    log.error("main: confine_init() fails: %s\n", error->c_str());
    return kNotConfined;
  }
  logWhatIsNotEnforced(confinement, log);
  log.debug("main: At most %llu descriptors",
            static_cast<unsigned long long>(LinuxConfinement::descriptorLimit()));
  return serve({settings, paths, config, options.logLevel}, log, counters, *inspector, broker.get(),
               std::move(deflate), memory, confinement, stopSignals, std::move(window));
}

}  // namespace kyt
