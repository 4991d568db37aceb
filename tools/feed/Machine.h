// The real adapters of this machine, as kytfeed's back end needs them.
#pragma once

#include <memory>
#include <optional>
#include <utility>

#include "backends/dashboard/DashboardBackend.h"
#include "platform/Bundle.h"
#include "platform/Counters.h"
#include "platform/Limits.h"
#include "platform/Platform.h"
#include "platform/UserBudget.h"
#include "platform/WorkerPool.h"
#include "platform/linux/LinuxMemoryInfo.h"
#include "platform/linux/LinuxRandom.h"
#include "platform/linux/OpenSSLCryptography.h"
#include "platform/linux/PugixmlPropertyLists.h"
#include "platform/linux/RapidJSONWriter.h"
#include "platform/linux/ZlibDeflate.h"
#include "platform/linux/base/EpollReactor.h"
#include "platform/linux/base/LinuxClock.h"
#include "platform/linux/base/LinuxUDPSocket.h"
#include "platform/linux/system/DlopenPluginBundles.h"
#include "platform/linux/system/JournalPowerLog.h"
#include "platform/linux/system/LinuxDeviceProperties.h"
#include "platform/linux/system/LinuxFileExtensions.h"
#include "platform/linux/system/LogSinks.h"
#include "platform/linux/system/TomlUserDefaults.h"
#include "platform/linux/url/CurlUrlSession.h"

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
  LinuxClock clock;
  std::unique_ptr<EpollReactor> reactor = EpollReactor::create();
  WorkerPool workers{WorkerPoolOptions{}};
  LinuxRandom random;
  LinuxMemoryInfo memory;
  OpenSSLCryptography cryptography;
  PugixmlPropertyLists propertyLists;
  RapidJSONWriter json;
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
  Platform platform{
      limits,       counters,         log,     clock,        *reactor,       *reactor,      workers,  random,
      userDefaults, deviceProperties, consent, cryptography, propertyLists,  json,          deflate,  memory,
      urlSessions,  udpSockets,       bundle,  bundle,       fileExtensions, pluginBundles, powerLog, budget};
  ~Machine() { end(); }
  // Nothing runs any more; what was counted stays.
  void end() {
    if (std::exchange(ended, true)) return;
    workers.shutDown();
    if (reactor) reactor->stop();
  }
};

}  // namespace kyt::tools
