// The platform as the daemon has it: the real adapters, in the order in which each needs those before it, and the
// list of ports that all the other code knows them by. Made after the process is confined. DaemonServices owns the one
// object; it outlives everything that has a reference to its `ports`.
//
// The composition root alone uses the adapters by name: for what a port does not say (how threads and transfers end), and
// for the listener.
#pragma once

#include <cstdint>
#include <memory>

#include "daemon/DaemonOutbox.h"
#include "platform/Deflate.h"
#include "platform/Platform.h"
#include "platform/base/Books.h"
#include "platform/base/Counters.h"
#include "platform/base/Paths.h"
#include "platform/base/ServerRecords.h"
#include "platform/base/Settings.h"
#include "platform/base/UserBudget.h"
#include "platform/linux/base/EpollReactor.h"
#include "platform/linux/base/LinuxClock.h"
#include "platform/linux/base/LinuxUDPSocket.h"
#include "platform/linux/data/LinuxMemoryInfo.h"
#include "platform/linux/data/LinuxRandom.h"
#include "platform/linux/data/OpenSSLCryptography.h"
#include "platform/linux/data/PugixmlPropertyLists.h"
#include "platform/linux/data/RapidJSON.h"
#include "platform/linux/device/DepartureFile.h"
#include "platform/linux/device/LinuxDeviceProperties.h"
#include "platform/linux/device/TomlUserDefaults.h"
#include "platform/linux/entitlements/TomlEntitlements.h"
#include "platform/linux/files/LinuxFileManager.h"
#include "platform/linux/helpers/DeletionBroker.h"
#include "platform/linux/helpers/LinuxFileExtensions.h"
#include "platform/linux/helpers/ProgramInspector.h"
#include "platform/linux/plugins/DlopenPluginBundles.h"
#include "platform/linux/service/JournalPowerLog.h"
#include "platform/linux/toml/TomlBundle.h"
#include "platform/linux/url/CurlURLSession.h"
#include "platform/queues/LargeWork.h"
#include "platform/queues/Log.h"
#include "platform/queues/WorkerPool.h"

namespace kyt {

struct DaemonPlatform {
  struct Start {
    const Settings& settings;
    const Paths& paths;
    Log& log;
    Counters& counters;
    ProgramInspector& inspector;
    const DeletionBroker* broker;  // null: uploaded files stay
    std::unique_ptr<EpollReactor> reactor;
    std::unique_ptr<Deflate> deflate;
    uint64_t memory = 0;       // bytes and
    uint64_t descriptors = 0;  // descriptors that the daemon may use, for the shares of users
  };
  explicit DaemonPlatform(Start start);
  // What of changed settings counts while the daemon runs, but for those that are read anew each time. Any thread.
  void takeUp(const Settings& settings);
  DaemonPlatform(const DaemonPlatform&) = delete;
  DaemonPlatform& operator=(const DaemonPlatform&) = delete;

  const uint64_t memoryForUsers, descriptorsForUsers;
  UserBudget budget;
  LinuxClock clock;
  Books books;
  ServerRecords servers;
  const std::unique_ptr<EpollReactor> reactor;
  WorkerPool workers;
  LargeWork largeWork;
  LinuxRandom random;
  LinuxMemoryInfo memory;
  OpenSSLCryptography cryptography;
  PugixmlPropertyLists propertyLists;
  RapidJSON json;
  const std::unique_ptr<Deflate> deflate;
  TomlUserDefaults userDefaults;
  LinuxDeviceProperties deviceProperties;
  DefaultsDiagnosticsConsent consent;
  TomlBundle clientBundle, daemonBundle;
  TomlEntitlements entitlements;
  DepartureFile departures;
  CurlURLSessionFactory network;
  const std::unique_ptr<DaemonOutbox> outbox;  // null: the settings want none
  URLSessionFactory& urlSessions;              // the network's, or those of the outbox before it
  LinuxUDPSocketFactory udpSockets;
  LinuxFileExtensions fileExtensions;
  DlopenPluginBundles pluginBundles;
  JournalPowerLog powerLog;
  LinuxFileManager files;
  Platform ports;
};

}  // namespace kyt
