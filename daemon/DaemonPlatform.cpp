#include "daemon/DaemonPlatform.h"

#include <utility>

#include "platform/base/Limits.h"
#include "platform/linux/base/Threads.h"
#include "platform/linux/service/Process.h"

namespace kyt {

namespace {

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

CurlURLSessionOptions urlSessionOptions(const Settings& settings, ServerRecords& servers) {
  CurlURLSessionOptions options;
  options.servers = &servers;
  options.certificateFile = settings.caFile;
  options.cellularInterfaces = settings.cellularInterfaces;
  options.whenQuiet = giveFreeMemoryBack;  // replies may end long after the last worker did
  return options;
}

constexpr char kConsentFile[] = "com.vantu.diagnostics.toml";  // of kDiagnosticsDefaultsDomain

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

}  // namespace

DaemonPlatform::DaemonPlatform(Start start)
    : memoryForUsers(start.memory),
      descriptorsForUsers(start.descriptors),
      budget(UserShares::of(start.settings.limits, start.memory, start.descriptors)),
      books(clock),
      reactor(std::move(start.reactor)),
      workers(workerPoolOptions(start.counters, start.log, budget)),
      deflate(std::move(start.deflate)),
      userDefaults(userDefaultsOptions(start.paths, budget), start.log, start.counters, clock),
      deviceProperties(deviceSources(start.paths), cryptography, start.log, clock),
      consent(userDefaults, start.paths.userDefaults() + "/" + kConsentFile),
      clientBundle(start.paths.clientBundle(), start.log),
      daemonBundle(start.paths.daemonBundle(), start.log),
      entitlements(entitlementsOptions(start.paths), start.inspector, start.log, start.counters, clock),
      departures(start.paths.userDefaults(), json, start.log, clock, *reactor,
                 SerialQueue::create("kyt.departures", workers)),
      network(urlSessionOptions(start.settings, servers), start.log, start.counters),
      outbox(start.settings.outbox.enabled
                 ? std::make_unique<DaemonOutbox>(
                       DaemonOutbox::Ports{start.settings.outbox, start.paths.outbox(), clock, *reactor,
                                           random, consent, start.counters, start.log, books, departures,
                                           network, *reactor, start.paths.userDefaults(), kConsentFile})
                 : nullptr),
      urlSessions(outbox ? outbox->sessions() : network),
      fileExtensions(start.broker, start.log, start.counters, budget),
      pluginBundles(start.paths.root, start.log),
      powerLog(start.counters),
      ports{
          .limits = start.settings.limits,
          .counters = start.counters,
          .log = start.log,
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
          .deflate = *deflate,
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
      } {}

void DaemonPlatform::takeUp(const Settings& settings) {
  const UserShares shares = UserShares::of(settings.limits, memoryForUsers, descriptorsForUsers);
  for (const ShareRow& row : kShareRows) budget.shares()[row.share] = shares[row.share];
  network.reconfigure({settings.caFile, settings.cellularInterfaces});
}

}  // namespace kyt
