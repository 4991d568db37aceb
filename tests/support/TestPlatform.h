// The platform of tests: clocks, timers, queues, randomness, files and the network are fakes that a test
// moves by hand; what is only computation (digests, property lists, JSON, deflate, the allocator's sizes) is
// the real thing. Change fields before the code under test reads them.
#pragma once

#include "config/Configuration.h"
#include "config/DeviceIdentity.h"
#include "config/Environment.h"
#include "platform/Platform.h"
#include "platform/base/Books.h"
#include "platform/base/Counters.h"
#include "platform/base/Limits.h"
#include "platform/base/UserBudget.h"
#include "platform/fake/FakeBundle.h"
#include "platform/fake/FakeConsent.h"
#include "platform/fake/FakeDepartures.h"
#include "platform/fake/FakeDeviceProperties.h"
#include "platform/fake/FakeFileExtensions.h"
#include "platform/fake/FakePluginBundles.h"
#include "platform/fake/FakePowerLog.h"
#include "platform/fake/FakeUDPSocket.h"
#include "platform/fake/FakeURLSession.h"
#include "platform/fake/FakeUserDefaults.h"
#include "platform/fake/FaultyDeflate.h"
#include "platform/fake/FixedRandom.h"
#include "platform/fake/ManualClock.h"
#include "platform/fake/ManualExecutor.h"
#include "platform/fake/ManualTimers.h"
#include "platform/fake/MemoryLogSink.h"
#include "platform/fake/MemoryStream.h"
#include "platform/linux/data/LinuxMemoryInfo.h"
#include "platform/linux/data/OpenSSLCryptography.h"
#include "platform/linux/data/PugixmlPropertyLists.h"
#include "platform/linux/data/RapidJSON.h"
#include "platform/linux/data/ZlibDeflate.h"
#include "platform/queues/LargeWork.h"
#include "platform/queues/Log.h"

namespace kyt {

struct TestPlatform {
  Limits limits;
  UserBudget budget{UserShares::of(limits, uint64_t{8} << 30, 65536)};
  Counters counters;
  Books books;
  MemoryLogSink sink;
  Log log{sink, LogLevel::debug};
  ManualClock clock;
  ManualTimers timers{clock};
  ManualReactor reactor;
  ManualExecutor executor;
  LargeWork largeWork{1};  // what would wait for itself shows
  FixedRandom random;
  FakeUserDefaults userDefaults;
  FakeDeviceProperties deviceProperties;
  FakeConsent consent;
  OpenSSLCryptography cryptography;
  PugixmlPropertyLists propertyLists;
  RapidJSON json;
  ZlibDeflate zlib;
  FaultyDeflate deflate{&zlib};
  LinuxMemoryInfo memory;
  FakeURLSessionFactory urlSessions;
  FakeUDPSockets udpSockets;
  FakeBundle clientBundle, daemonBundle;
  FakeFileExtensions fileExtensions;
  FakePluginBundles pluginBundles;
  FakePowerLog powerLog;
  FakeDepartures departures;

  Platform platform{
      .limits = limits,
      .counters = counters,
      .log = log,
      .clock = clock,
      .timers = timers,
      .reactor = reactor,
      .executor = executor,
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
      .clientBundle = clientBundle,
      .daemonBundle = daemonBundle,
      .fileExtensions = fileExtensions,
      .pluginBundles = pluginBundles,
      .powerLog = powerLog,
      .budget = budget,
      .books = books,
      .departures = departures,
  };

  DeviceIdentity deviceIdentity{platform};
  Environment environment{platform, deviceIdentity,
                          StorebagHosts{"https://partners.example.org", "https://bags.example.org"}};
  Configuration configuration{platform, deviceIdentity, environment};
};

}  // namespace kyt
