// The real adapters of this machine, as kytfeed's back end needs them.
#pragma once

#include <memory>
#include <optional>
#include <utility>

#include "backends/dashboard/DashboardBackend.h"
#include "platform/Bundle.h"
#include "platform/Platform.h"
#include "platform/base/Books.h"
#include "platform/base/Counters.h"
#include "platform/base/Departures.h"
#include "platform/base/Limits.h"
#include "platform/base/UserBudget.h"
#include "platform/linux/base/EpollReactor.h"
#include "platform/linux/base/LinuxClock.h"
#include "platform/linux/base/LinuxUDPSocket.h"
#include "platform/linux/data/LinuxMemoryInfo.h"
#include "platform/linux/data/LinuxRandom.h"
#include "platform/linux/data/OpenSSLCryptography.h"
#include "platform/linux/data/PugixmlPropertyLists.h"
#include "platform/linux/data/RapidJSON.h"
#include "platform/linux/data/ZlibDeflate.h"
#include "platform/linux/device/LinuxDeviceProperties.h"
#include "platform/linux/device/TomlUserDefaults.h"
#include "platform/linux/helpers/LinuxFileExtensions.h"
#include "platform/linux/plugins/DlopenPluginBundles.h"
#include "platform/linux/service/JournalPowerLog.h"
#include "platform/linux/service/LogSinks.h"
#include "platform/linux/url/CurlURLSession.h"
#include "platform/queues/LargeWork.h"
#include "platform/queues/WorkerPool.h"

namespace kyt::tools {

class NoBundle final : public Bundle {
 public:
  std::optional<String> version() override { return std::nullopt; }
  std::optional<Data> resource(std::string_view, std::string_view) override { return std::nullopt; }
};

// The real adapters of this machine. What a dashboard back end never asks for is there all the same, since
// every back end is made with all ports; nothing is stored anywhere.
struct Machine {
  bool ended = false;
  StderrSink sink;
  Log log{sink};
  Limits limits;
  Counters counters;
  Books books;
  LinuxClock clock;
  std::unique_ptr<EpollReactor> reactor = EpollReactor::create();
  WorkerPool workers{WorkerPoolOptions{}};
  LargeWork largeWork;
  LinuxRandom random;
  LinuxMemoryInfo memory;
  OpenSSLCryptography cryptography;
  PugixmlPropertyLists propertyLists;
  RapidJSON json;
  ZlibDeflate deflate;
  TomlUserDefaults userDefaults{{"/nonexistent"}, log, counters, clock};
  LinuxDeviceProperties deviceProperties{DeviceSources{}, cryptography, log, clock};
  DefaultsDiagnosticsConsent consent{userDefaults};
  CurlURLSessionFactory urlSessions{CurlURLSessionOptions{}, log, counters};
  LinuxUDPSocketFactory udpSockets;
  NoBundle bundle;
  UserBudget budget{UserShares::of(limits, ~uint64_t{0}, ~uint64_t{0})};
  LinuxFileExtensions fileExtensions{nullptr, log, counters, budget};
  DlopenPluginBundles pluginBundles{"/nonexistent", log};
  JournalPowerLog powerLog{counters};
  NoDepartures departures;
  Platform platform{
      .limits = limits,
      .counters = counters,
      .log = log,
      .clock = clock,
      .timers = *reactor,
      .reactor = *reactor,
      .executor = workers,
      .largeWork = largeWork,
      .random = random,
      .userDefaults = userDefaults,
      .deviceProperties = deviceProperties,
      .consent = consent,
      .cryptography = cryptography,
      .propertyLists = propertyLists,
      .json = json,
      .deflate = deflate,
      .memory = memory,
      .urlSessions = urlSessions,
      .udpSockets = udpSockets,
      .clientBundle = bundle,
      .daemonBundle = bundle,
      .fileExtensions = fileExtensions,
      .pluginBundles = pluginBundles,
      .powerLog = powerLog,
      .budget = budget,
      .books = books,
      .departures = departures,
  };
  ~Machine() { end(); }
  // Nothing runs any more; what was counted stays.
  void end() {
    if (std::exchange(ended, true)) return;
    workers.shutDown();
    if (reactor) reactor->stop();
  }
};

}  // namespace kyt::tools
