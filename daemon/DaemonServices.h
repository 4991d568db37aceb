// Every object of the running daemon, in the order in which each needs those before it; they are destroyed in
// reverse. Made by runDaemon() after the process is confined.
#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "backend/BackendFactory.h"
#include "config/Configuration.h"
#include "config/DeviceIdentity.h"
#include "config/Environment.h"
#include "config/StorebagFetcher.h"
#include "daemon/ReportingdAgent.h"
#include "platform/Deflate.h"
#include "platform/Entitlements.h"
#include "platform/Platform.h"
#include "platform/base/Counters.h"
#include "platform/base/Mutex.h"
#include "platform/base/Paths.h"
#include "platform/base/Settings.h"
#include "platform/base/UserBudget.h"
#include "platform/ipc/DBusServer.h"
#include "platform/linux/base/EpollReactor.h"
#include "platform/linux/base/LinuxClock.h"
#include "platform/linux/base/LinuxUDPSocket.h"
#include "platform/linux/data/LinuxMemoryInfo.h"
#include "platform/linux/data/LinuxRandom.h"
#include "platform/linux/data/OpenSSLCryptography.h"
#include "platform/linux/data/PugixmlPropertyLists.h"
#include "platform/linux/data/RapidJSON.h"
#include "platform/linux/device/LinuxDeviceProperties.h"
#include "platform/linux/device/TomlUserDefaults.h"
#include "platform/linux/entitlements/TomlEntitlements.h"
#include "platform/linux/files/LinuxFileManager.h"
#include "platform/linux/helpers/DeletionBroker.h"
#include "platform/linux/helpers/LinuxFileExtensions.h"
#include "platform/linux/helpers/ProgramInspector.h"
#include "platform/linux/plugins/DlopenPluginBundles.h"
#include "platform/linux/service/JournalPowerLog.h"
#include "platform/linux/service/ServiceManager.h"
#include "platform/linux/service/Watchdog.h"
#include "platform/linux/toml/TomlBundle.h"
#include "platform/linux/url/CurlURLSession.h"
#include "platform/queues/LineLimits.h"
#include "platform/queues/Log.h"
#include "platform/queues/SerialQueue.h"
#include "platform/queues/WorkerPool.h"
#include "session/MessageLogFiles.h"
#include "session/ReportingdSessionClass.h"

namespace kyt {

class DaemonServices {
 public:
  struct Start {
    const Settings& settings;
    const Paths& paths;
    Log& log;
    Counters& counters;
    ProgramInspector& inspector;
    const DeletionBroker* broker;  // null: uploaded files stay
    std::unique_ptr<EpollReactor> reactor;
    std::unique_ptr<StreamAcceptor> acceptor;
    std::unique_ptr<Deflate> deflate;
    bool socketActivated = false;
    uint64_t memory = 0;       // bytes and
    uint64_t descriptors = 0;  // descriptors that the daemon may use, for the shares of users
    // The daemon has been idle for long enough and nothing is outstanding. Any thread.
    std::function<void()> idle;
  };
  explicit DaemonServices(Start start);
  ~DaemonServices();
  DaemonServices(const DaemonServices&) = delete;
  DaemonServices& operator=(const DaemonServices&) = delete;

  // The listener takes connections from now on, and a service manager that asked for it is told that the daemon lives.
  void resume();
  // The orderly end: refuses new work, ends every session on its queue, waits for outstanding requests, all
  // under one deadline, and ends all threads. Once, on the main thread. False when threads would not end: then the
  // process must, without destroying this.
  [[nodiscard]] bool shutDown();

 private:
  class Deadline;
  [[nodiscard]] bool endWhenIdle();
  [[nodiscard]] bool isIdle() const;
  [[nodiscard]] bool isOutstanding() const;
  [[nodiscard]] bool sessionsEndWithin(const Deadline& deadline);
  void endSessions(const Deadline& deadline);
  void waitForRequests(const Deadline& deadline);
  void logFigures();

  const Settings& settings_;
  Log& log_;
  Counters& counters_;
  const std::function<void()> idle_;
  UserBudget budget_;
  LinuxClock clock_;
  std::unique_ptr<EpollReactor> reactor_;
  WorkerPool workers_;
  LinuxRandom random_;
  LinuxMemoryInfo memory_;
  OpenSSLCryptography cryptography_;
  PugixmlPropertyLists propertyLists_;
  RapidJSON json_;
  const std::unique_ptr<Deflate> deflate_;
  TomlUserDefaults userDefaults_;
  LinuxDeviceProperties deviceProperties_;
  DefaultsDiagnosticsConsent consent_;
  TomlBundle clientBundle_, daemonBundle_;
  TomlEntitlements entitlements_;
  CurlURLSessionFactory urlSessions_;
  LinuxUDPSocketFactory udpSockets_;
  LinuxFileExtensions fileExtensions_;
  DlopenPluginBundles pluginBundles_;
  JournalPowerLog powerLog_;
  Platform platform_;

  DeviceIdentity deviceIdentity_;
  Environment environment_;
  Configuration configuration_;
  DefaultBackendFactory backendFactory_;
  LinuxFileManager fileManager_;
  MessageLogFiles messageLog_;
  Mutex backendClassLock_;
  StorebagFetcher fetcher_;
  ReportingdSessionClass sessionClass_;
  std::atomic<bool> resumed_{false};
  std::shared_ptr<SerialQueue> queue_;  // the daemon's own
  LineLimits lineLimits_;
  LinuxProcessTransaction transaction_;
  ReportingdAgent agent_;
  DBusServer listener_;
  std::optional<Watchdog> watchdog_;
};

}  // namespace kyt
