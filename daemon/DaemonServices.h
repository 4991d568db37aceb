// Every object of the running daemon, in the order in which each needs those before it; they are destroyed in
// reverse. Made by runDaemon() after the process is confined. What the system gives is one of them (DaemonPlatform.h).
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
#include "daemon/Administration.h"
#include "daemon/DaemonPlatform.h"
#include "daemon/DaemonReload.h"
#include "daemon/ReportingdAgent.h"
#include "platform/base/Mutex.h"
#include "platform/ipc/DBusServer.h"
#include "platform/linux/service/ServiceManager.h"
#include "platform/linux/service/Watchdog.h"
#include "platform/queues/LineLimits.h"
#include "platform/queues/SerialQueue.h"
#include "session/MessageLogFiles.h"
#include "session/ReportingdSessionClass.h"

namespace kyt {

class DaemonServices {
 public:
  // What administrators look through.
  struct WindowStart {
    std::string version;
    AdministrationAccess access;
    std::unique_ptr<StreamAcceptor> acceptor;  // null: there is no window
  };
  // Where changed settings are read, and what they go into.
  struct ReloadStart {
    Settings& running;
    std::string file;
    std::optional<LogLevel> commandLine;
  };
  struct Start {
    DaemonPlatform::Start system;
    std::string messageLogs;  // folder
    std::unique_ptr<StreamAcceptor> acceptor;
    WindowStart window;
    ReloadStart reload;
    bool socketActivated = false;
    // The daemon has been idle for long enough and nothing is outstanding. Any thread.
    std::function<void()> idle;
  };
  explicit DaemonServices(Start start);
  ~DaemonServices();
  DaemonServices(const DaemonServices&) = delete;
  DaemonServices& operator=(const DaemonServices&) = delete;

  // The listener takes connections from now on, and a service manager that asked for it is told that the daemon lives.
  void resume();
  // Takes up changed settings. Any thread.
  void reload() { static_cast<void>(reload_.reload()); }
  // The orderly end: refuses new work, ends every session on its queue, waits for outstanding requests, all
  // under one deadline, and ends all threads. Once, on the main thread. False when threads would not end: then the
  // process must, without destroying this.
  [[nodiscard]] bool shutDown();
  // The end that the owner asks for, who erases what the daemon knows: nothing is sent any more. Does not return.
  [[noreturn]] void endWithoutSending();

 private:
  class Deadline;
  [[nodiscard]] bool endWhenIdle();
  [[nodiscard]] bool isIdle() const;
  [[nodiscard]] bool isOutstanding() const;
  [[nodiscard]] bool sessionsEndWithin(const Deadline& deadline);
  void endSessions(const Deadline& deadline);
  void waitForRequests(const Deadline& deadline);
  void logFigures();
  [[nodiscard]] OutboxOperations outboxOperations();
  [[nodiscard]] AdministrationSources administrationSources(std::string version, ProgramInspector& inspector);
  [[nodiscard]] DBusServerServices serverServices();

  const Settings& settings_;
  Log& log_;
  Counters& counters_;
  const std::function<void()> idle_;
  DaemonPlatform system_;
  DaemonReload reload_;

  DeviceIdentity deviceIdentity_;
  Environment environment_;
  Configuration configuration_;
  DefaultBackendFactory backendFactory_;
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
  Administration administration_;
  std::optional<DBusServer> windows_;  // connections there neither count nor keep the daemon
  std::optional<Watchdog> watchdog_;
};

}  // namespace kyt
